// What the uploads contain, checked with the real programs: `fbfctl explain`
// shows byte for byte what the next flush uploads, and nothing planted in a
// field the README does not list as uploaded ever reaches the receiver.
#include "corevireon.pb.h"
#include "e2e/daemon_home.h"
#include "upload/upload_test_util.h"

#include <strings.h>

#include <fstream>
#include <regex>

namespace fbf::testing {
namespace {

using corevireon::CVClientSession;
using corevireon::CVFeedbackPayload;
using google::protobuf::FieldDescriptor;
using google::protobuf::Message;

// The digest header, whatever case the receiver recorded its name in.
std::string digestOf(const nlohmann::json& record) {
  for (const auto& [name, value] : record.at("headers").items()) {
    if (strcasecmp(name.c_str(), "x-corvane-digest") == 0) return value.get<std::string>();
  }
  return {};
}

// Guards against: explain showing other bytes than the flush sends, explain
// reading what is not a pending file, and any field not listed as uploaded
// (or a device time) reaching the receiver.
class UploadContent : public ReceiverTest {
 protected:
  void SetUp() override {
    ReceiverTest::SetUp();
    home.startDaemon();
  }
};

TEST_F(UploadContent, ExplainRefusesWhatIsNotAPendingFileOfTheCacheDirectory) {
  ASSERT_EQ(home.generate(1, 0, 5).status, 0);
  const fs::path session = home.cacheDir() / home.sessionFiles().front();
  const fs::path link = home.cacheDir() / "session.4242.00000001-1111-4222-8333-444455556666.closed";
  fs::create_symlink(session, link);
  const fs::path outside = home.root() / session.filename();
  fs::copy_file(session, outside);
  for (const auto& path : {link, outside, home.cacheDir() / "bag.plist"}) {
    auto r = home.fbfctl({"explain", path.string()});
    EXPECT_EQ(r.status, 1) << path;
    EXPECT_TRUE(r.out.empty()) << path;
    EXPECT_EQ(r.err.rfind("fbfctl: ", 0), 0u) << r.err;
  }
}

// Reads the table of README "What leaves the device": the fields marked as
// uploaded ("yes ..."), as "Message.field".
std::set<std::string> fieldsListedAsUploaded() {
  std::ifstream in(FBF_README);
  std::set<std::string> out;
  bool inSection = false;
  static const std::regex row(R"(^\| `(\w+)` \| ([^|]*) \| (.*)\|$)");
  static const std::regex name("`(\\w+)`");
  for (std::string line; std::getline(in, line);) {
    if (line.rfind("## ", 0) == 0) inSection = line == "## What leaves the device";
    std::smatch m;
    if (!inSection || !std::regex_match(line, m, row)) continue;
    if (m[3].str().rfind("yes", 0) != 0) continue;
    const std::string fields = m[2].str();
    for (std::sregex_iterator it(fields.begin(), fields.end(), name), end; it != end; ++it) {
      out.insert(m[1].str() + "." + (*it)[1].str());
    }
  }
  return out;
}

// Fills every string field of a message tree: uploaded fields with plain
// text, every other one with a fresh canary; sets every feedback time to a
// device-clock reading; appends a field this build does not know, with a
// canary, to every message.
class CanaryFiller {
 public:
  explicit CanaryFiller(std::set<std::string> uploaded) : uploaded_(std::move(uploaded)) {}

  void fill(Message& m, int depth = 0, const FieldDescriptor* skip = nullptr) {
    const auto* d = m.GetDescriptor();
    const auto* r = m.GetReflection();
    for (int i = 0; i < d->field_count(); ++i) {
      const FieldDescriptor* f = d->field(i);
      if (f == skip || f->real_containing_oneof() != nullptr || f->is_map()) continue;
      if (f->cpp_type() == FieldDescriptor::CPPTYPE_STRING) {
        const bool plain = uploaded_.count(d->name() + "." + f->name()) != 0;
        const std::string value = plain ? "plain text" : canary();
        f->is_repeated() ? r->AddString(&m, f, value) : r->SetString(&m, f, value);
      } else if (f->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE && depth < 6) {
        fill(f->is_repeated() ? *r->AddMessage(&m, f) : *r->MutableMessage(&m, f), depth + 1);
      } else if (f->name() == "timestamp" && f->cpp_type() == FieldDescriptor::CPPTYPE_UINT64) {
        r->SetUInt64(&m, f, kDeviceTime + 1'000'000 * ++ticks_);
      }
    }
    r->MutableUnknownFields(&m)->AddLengthDelimited(9001, canary());
  }

  std::string canary() {
    std::string c = "cnry" + std::to_string(100000 + planted_.size());
    planted_.push_back(c);
    return c;
  }
  const std::vector<std::string>& planted() const { return planted_; }

  // Device uptime in nanoseconds, far above any relative time in ms.
  static constexpr uint64_t kDeviceTime = 7'000'000'000'000'000;

 private:
  std::set<std::string> uploaded_;
  std::vector<std::string> planted_;
  uint64_t ticks_ = 0;
};

// The largest "timestamp" anywhere in a decoded upload.
uint64_t largestTimestamp(const nlohmann::json& j) {
  uint64_t most = 0;
  if (j.is_object()) {
    for (const auto& [key, value] : j.items()) {
      if (key == "timestamp" && value.is_number_unsigned()) most = std::max(most, value.get<uint64_t>());
      if (key == "timestamp" && value.is_string()) most = std::max<uint64_t>(most, std::stoull(value.get<std::string>()));
      most = std::max(most, largestTimestamp(value));
    }
  } else if (j.is_array()) {
    for (const auto& v : j) most = std::max(most, largestTimestamp(v));
  }
  return most;
}

// One session holding every feedback message kind, each filled by the
// descriptors, led by a payload without a message; unknown fields at every
// level, and a payload kind this build does not know (as a newer search
// daemon would write it). Flushed in both formats: no canary reaches the
// receiver, and no device time does.
TEST_F(UploadContent, NothingOutsideTheReadmeTableLeavesTheDevice) {
  const auto uploaded = fieldsListedAsUploaded();
  ASSERT_GT(uploaded.size(), 15u) << "the README table was not found";
  ASSERT_EQ(uploaded.count("CVSearchResultForFeedback.identifier"), 0u);

  uint32_t n = 0;
  for (const std::string format : {"FeedbackV2PB", "FeedbackV2"}) {
    home.writeBag(receiver->url(), {{"vireon_feedback_format", format}});
    CanaryFiller filler(uploaded);
    CVClientSession session;
    filler.fill(session, 0, CVClientSession::descriptor()->FindFieldByName("feedbacks"));
    auto* list = session.mutable_feedbacks()->mutable_items();
    CVFeedbackPayload* messageless = list->Add();
    messageless->set_type(42);
    messageless->GetReflection()->MutableUnknownFields(messageless)->AddLengthDelimited(9002, filler.canary());
    const auto* oneof = CVFeedbackPayload::descriptor()->FindOneofByName("codable");
    for (int i = 0; i < oneof->field_count(); ++i) {
      CVFeedbackPayload* p = list->Add();
      p->set_queryid(7);
      p->set_type(i + 1);
      filler.fill(*p->GetReflection()->MutableMessage(p, oneof->field(i)));
    }
    // A newer kind of feedback, carrying a result: field 99 of the payload.
    corevireon::CVSearchResultForFeedback result;
    filler.fill(result);
    list->Add()->GetReflection()->MutableUnknownFields(&list->at(list->size() - 1))
        ->AddLengthDelimited(99, result.SerializeAsString());

    char uuid[40];
    std::snprintf(uuid, sizeof uuid, "%08X-1111-4222-8333-444455556666", ++n);
    const fs::path path = home.cacheDir() / (std::string("session.4242.") + uuid + ".closed");
    writeFile(path, session.SerializeAsString());
    const std::string file = readFile(path);
    for (const auto& c : filler.planted()) ASSERT_NE(file.find(c), std::string::npos) << c << " was not planted";

    // explain writes exactly what the next flush uploads, and sends nothing.
    const size_t before = receiver->records().size();
    const auto explained = home.fbfctl({"explain", "--raw", path.string()});
    ASSERT_EQ(explained.status, 0) << explained.err;
    const std::string& payload = explained.out;
    flush();
    auto records = receiver->records();
    ASSERT_EQ(records.size(), before + 1) << format;
    const auto& record = records.back();
    // The decoded body shows known fields; the raw payload, proven to be the
    // uploaded bytes by the digest, shows the unknown ones too.
    ASSERT_EQ(digestOf(record), sha512Hex(payload)) << format;
    ASSERT_FALSE(record["decoded"].is_null()) << record.dump();
    const std::string seen = record.dump() + payload;
    for (const auto& c : filler.planted()) EXPECT_EQ(seen.find(c), std::string::npos) << format << " leaks " << c;
    EXPECT_LT(largestTimestamp(record["decoded"]), 1'000'000u) << format << ": a device time was uploaded";
  }
}

}  // namespace
}  // namespace fbf::testing
