// The flusher over a real cache directory in a temporary home, with a fake
// upload manager that prepares requests without compressing and holds every
// upload until the test settles it, so a test decides when (and how) each
// upload ends.
#include "flushing/feedback_flusher.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "flushing/flushing_test_util.h"
#include "processing/processing_builders.h"

#include <algorithm>
#include <cstdio>
#include <deque>

namespace fbf::testing {
namespace {

constexpr uint64_t kSizeLimit = 2'097'152;
constexpr int kTooOld = 1, kTooLarge = 2, kEmpty = 3, kPruned = 4, kNoConsent = 5;
using Pairs = std::vector<std::pair<std::string, int>>;

class FakeUploadManager final : public UploadManagerProtocol {
 public:
  using Prepared = std::pair<fs::path, std::string>;  // (source or upload file, type)
  struct Log {
    std::set<Prepared> prepared, retried;
    std::deque<std::pair<UploadRequest, UploadCompletion>> pending;
    std::function<void()> onEnqueue;  // called while the flusher is still in enqueue
  };

  explicit FakeUploadManager(std::shared_ptr<Log> log) : log_(std::move(log)) {}

  // These tests run with the protobuf format only; the payload is ready at once.
  void prepareSessionUpload(std::string payload, UploadFormat format, const fs::path& sessionURL,
                            PreparationCompletion completion) override {
    EXPECT_EQ(format, UploadFormat::pb);
    completion(prepared(sessionURL, payload.size(), "FeedbackV2PB"));
  }
  std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) override {
    return prepared(fileURL, fs::file_size(fileURL), type);
  }
  void enqueue(UploadRequest request, UploadCompletion completion) override {
    log_->pending.emplace_back(std::move(request), std::move(completion));
    if (log_->onEnqueue) log_->onEnqueue();
  }
  void retryUpload(const fs::path& fileURL, const std::string& type) override {
    log_->retried.emplace(fileURL, type);
  }
  size_t uploadsInFlight() const override { return log_->pending.size(); }
  void setDelegate(UploadManagerDelegate* delegate) override { delegate_ = delegate; }

  // Ends the oldest pending upload with an HTTP `status` as the real manager
  // does: the count drops, then the completion and the delegate hear of it.
  // Must run on the work queue's thread.
  void settleOldest(long status) {
    auto [request, completion] = std::move(log_->pending.front());
    log_->pending.pop_front();
    if (status == 200) fs::remove(request.fileURL);
    if (completion) completion(HttpResponse{status, {}}, std::nullopt);
    if (delegate_) delegate_->uploadManagerDidUploadFile(request.fileURL, status);
  }

 private:
  // Logs the preparation; the upload file exists, as the real manager's would.
  std::optional<UploadRequest> prepared(const fs::path& source, uint64_t size, const std::string& type) {
    log_->prepared.emplace(source, type);
    fs::path uploadFile = source.string() + ".uploadPending";
    if (FILE* f = std::fopen(uploadFile.c_str(), "w")) std::fclose(f);
    return UploadRequest{{}, std::move(uploadFile), static_cast<int64_t>(size), static_cast<int64_t>(size / 2), type, {}};
  }

  std::shared_ptr<Log> log_;
  UploadManagerDelegate* delegate_ = nullptr;
};

// A parseable session whose serialised form is exactly `bytes` long (the
// agent string pads it), or as small as possible when `bytes` is 0.
std::string sessionBytes(size_t bytes = 0) {
  corevireon::CVClientSession s;
  *s.mutable_feedbacks()->add_items() = clearInput(1'000'000'000, 7);
  for (size_t pad = bytes; bytes != 0 && s.ByteSizeLong() != bytes; pad += bytes - s.ByteSizeLong()) {
    s.set_agent(std::string(pad, 'a'));
  }
  return s.SerializeAsString();
}

class FlushWithHeldUploads : public ::testing::Test {
 protected:
  void SetUp() override {
    env.writeBag({{"feedback_url", "https://127.0.0.1:9/feedback"}, {"vireon_feedback_format", "FeedbackV2PB"},
                  {"max_custom_feedback_sizes", {{"Pelorus", 10}}}});
    setConsent(true);
  }
  // Held completions keep their flusher alive; drop them with the test.
  void TearDown() override { uploads->pending.clear(); }

  void setConsent(bool enabled) {
    env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::ConsentDomain))
        ->setObject(FBFStrings::LinuxDefaults::DiagnosticsAndUsageEnabled, enabled);
  }

  // Runs a whole walk; uploads stay pending.
  void flush() {
    FlusherDependencies deps;
    deps.uploadManagerFactory = [this](FBFAssemblyProtocol&) -> std::unique_ptr<UploadManagerProtocol> {
      auto m = std::make_unique<FakeUploadManager>(uploads);
      manager = m.get();
      return m;
    };
    // Sessions first, then the custom directories, each in directory order.
    deps.randomChoice = [](size_t) { return size_t{0}; };
    flusher = FeedbackFlusher::make(env.assembly(), std::move(deps));
    flusher->beginEnumeratingFeedback([this] { ++completions; });
    env.manualQueue->drain();
  }

  void settle(long status, size_t count = SIZE_MAX) {
    for (; count > 0 && !uploads->pending.empty(); --count) {
      env.manualQueue->async([this, status] { manager->settleOldest(status); });
      env.manualQueue->drain();
    }
  }

  fs::path closedSession(unsigned n, const std::string& bytes) {
    return makeFile(env.cacheDir(), sessionName(SessionFileState::closed, n), bytes);
  }
  fs::path custom(const std::string& type, const std::string& name, const std::string& bytes) {
    auto path = env.cacheDir() / "CustomFeedback" / type / name;
    writeFile(path, bytes);
    return path;
  }

  // Deletion events as (type name, reason), sorted, and their payloads.
  Pairs deletions(std::vector<nlohmann::json>* payloads = nullptr) const {
    Pairs out;
    for (const auto& [name, payload] : env.analytics->events()) {
      if (name != FBFStrings::FeedbackLossEventName) continue;
      out.emplace_back(knownFeedbackTypeName(payload.at("feedbackType").get<int>()), payload.at("reason").get<int>());
      if (payloads) payloads->push_back(payload);
    }
    std::sort(out.begin(), out.end());
    return out;
  }

  TestEnvironment env;
  std::shared_ptr<FakeUploadManager::Log> uploads = std::make_shared<FakeUploadManager::Log>();
  FakeUploadManager* manager = nullptr;
  std::shared_ptr<FeedbackFlusher> flusher;
  int completions = 0;
};

struct LimitRow {
  const char* name;
  size_t bytes;  // 0: a small session; 1: undecodable bytes
  int ageDays;
  Pairs dropped;         // empty: uploaded (or, undecodable, kept in processing)
  uint64_t reportedKiB;  // the size in the deletion event, rounded up
  const char* log;
};

class SessionAtTheLimits : public FlushWithHeldUploads, public ::testing::WithParamInterface<LimitRow> {};

// Guards against: a session past its age or size limit being uploaded, or one at the limit being dropped.
TEST_P(SessionAtTheLimits, AgeIsJudgedFirstThenSize) {
  const LimitRow& row = GetParam();
  LogCapture logs;
  auto file = closedSession(1, row.bytes == 1 ? std::string("\xff\xff\xff garbage", 12) : sessionBytes(row.bytes));
  ASSERT_EQ(fs::file_size(file), row.bytes > 1 ? row.bytes : fs::file_size(file));
  env.clock->advance(std::chrono::hours(24 * row.ageDays));
  flush();
  std::vector<nlohmann::json> payloads;
  EXPECT_EQ(deletions(&payloads), row.dropped);
  EXPECT_EQ(payloads.empty() ? 0 : payloads[0].at("size").get<uint64_t>(), row.reportedKiB);
  const bool uploaded = row.dropped.empty() && row.bytes != 1;
  std::set<FakeUploadManager::Prepared> expected;
  if (uploaded) expected.emplace(env.cacheDir() / sessionName(SessionFileState::processing, 1), "FeedbackV2PB");
  EXPECT_EQ(uploads->prepared, expected);
  EXPECT_EQ(uploads->pending.size(), expected.size());
  EXPECT_FALSE(fs::exists(file));
  // Undecodable sessions are the file's own fault: they stay in processing, unreported.
  EXPECT_EQ(fs::exists(env.cacheDir() / sessionName(SessionFileState::processing, 1)), row.bytes == 1);
  EXPECT_TRUE(!*row.log || logs.contains(row.log)) << row.log;
}

INSTANTIATE_TEST_SUITE_P(
    Rows, SessionAtTheLimits,
    ::testing::Values(
        LimitRow{"ExactlyTheSizeLimit", kSizeLimit, 0, {}, 0, ""},
        LimitRow{"OneByteOver", kSizeLimit + 1, 0, {{"FeedbackV2PB", kTooLarge}}, kSizeLimit / 1024 + 1,
                 "because size exceeds maximum size 2048KB"},
        LimitRow{"EightDaysOld", 0, 8, {{"FeedbackV2PB", kTooOld}}, 1, "Discarding session because it's too old"},
        LimitRow{"SixDaysOld", 0, 6, {}, 0, ""},
        LimitRow{"EightDaysOldAndOneByteOver", kSizeLimit + 1, 8, {{"FeedbackV2PB", kTooOld}}, kSizeLimit / 1024 + 1,
                 "too old"},
        LimitRow{"Undecodable", 1, 0, {}, 0, "did not deserialize"}),
    [](const auto& info) { return std::string(info.param.name); });

// Guards against: custom feedback that is empty, over its type's limit or without consent being sent, or valid feedback being dropped.
using CustomFeedbackChecks = FlushWithHeldUploads;

TEST_F(CustomFeedbackChecks, WithoutConsentOnlyTheUserReportPassesTheChecks) {
  setConsent(false);
  LogCapture logs;
  const fs::path dropped[] = {custom("Pelorus", "empty", ""), custom("Pelorus", "over", "0123456789A"),
                              custom("Pelorus", "at-limit", "0123456789")};
  auto report = custom("UserReport", "r1", "{\"text\":\"it broke\"}");
  flush();
  EXPECT_EQ(uploads->prepared, (std::set<FakeUploadManager::Prepared>{{report, "UserReport"}}));
  for (const auto& f : dropped) EXPECT_FALSE(fs::exists(f)) << f;
  EXPECT_EQ(deletions(), (Pairs{{"Pelorus", kTooLarge}, {"Pelorus", kEmpty}, {"Pelorus", kNoConsent}}));
  EXPECT_TRUE(logs.contains("discarding Pelorus custom feedback because it's empty"));
}

// Guards against: the walk claiming, compressing again or deleting files that are not closed sessions.
using FilesInOtherStates = FlushWithHeldUploads;

TEST_F(FilesInOtherStates, PendingUploadsAreRetriedOtherSessionsLeftAlone) {
  // Retried session uploads are covered with the real programs, where the receiver decodes them by type.
  auto customUpload = custom("Pelorus", "p1.uploadPending", "compressed-custom");
  for (auto state : {SessionFileState::open, SessionFileState::processing, SessionFileState::uploaded}) {
    makeFile(env.cacheDir(), sessionName(state, 10 + static_cast<unsigned>(state)), sessionBytes());
  }
  const auto before = entryNames(env.cacheDir());
  flush();
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_EQ(uploads->retried, (std::set<FakeUploadManager::Prepared>{{customUpload, "Pelorus"}}));
  EXPECT_EQ(readFile(customUpload), "compressed-custom");
  EXPECT_EQ(entryNames(env.cacheDir()), before);
  EXPECT_TRUE(deletions().empty());
  EXPECT_EQ(completions, 1);
}

TEST_F(FilesInOtherStates, WithoutABagNothingIsTouched) {
  fs::remove(env.cacheDir() / "bag.plist");
  LogCapture logs;
  closedSession(1, sessionBytes(kSizeLimit + 1));
  custom("Pelorus", "empty", "");
  for (unsigned i = 10; i < 111; ++i) makeFile(env.cacheDir(), sessionName(SessionFileState::processing, i));
  const auto before = entryNames(env.cacheDir());
  flush();
  EXPECT_EQ(entryNames(env.cacheDir()), before);
  EXPECT_TRUE(uploads->prepared.empty());
  EXPECT_TRUE(deletions().empty());
  EXPECT_EQ(completions, 1);
  EXPECT_TRUE(logs.contains("Flusher didn't find a cached bag, bailing on this flush"));
}

// Guards against: the flush completing early, twice, or never, and a stop that does not stop the walk.
using FlushCompletion = FlushWithHeldUploads;

TEST_F(FlushCompletion, WaitsForEveryUploadSuccessfulOrNot) {
  for (unsigned i = 1; i <= 2; ++i) closedSession(i, sessionBytes());
  custom("Pelorus", "p1", "{}");
  flush();
  ASSERT_EQ(uploads->pending.size(), 3u);
  settle(200, 2);
  EXPECT_EQ(completions, 0) << "one upload is still in flight";
  settle(500);
  EXPECT_EQ(completions, 1);
  // A late delegate call (an upload of someone else) does not complete again.
  env.manualQueue->async([this] { flusher->uploadManagerDidUploadFile(env.cacheDir() / "x", 200); });
  env.manualQueue->drain();
  EXPECT_EQ(completions, 1);
}

TEST_F(FlushCompletion, StopEndsTheWalkBetweenFiles) {
  std::vector<fs::path> files;
  for (unsigned i = 1; i <= 3; ++i) files.push_back(closedSession(i, sessionBytes()));
  // The stop arrives while the first file is being handed to the uploader.
  uploads->onEnqueue = [this] { flusher->stopEnumeratingFeedback(); };
  flush();
  ASSERT_EQ(uploads->prepared.size(), 1u);
  EXPECT_EQ(std::count_if(files.begin(), files.end(), [](const auto& f) { return fs::exists(f); }), 2)
      << "the walk went on after the stop";
  EXPECT_EQ(completions, 0);
  settle(200);
  EXPECT_EQ(completions, 1);
}

// Guards against: more than a hundred leftover sessions not being cut to fifty after the walk, or cut without a report.
TEST_F(FlushWithHeldUploads, HundredAndOneLeftoverSessionsAreCutToFifty) {
  for (unsigned i = 0; i < 101; ++i) makeFile(env.cacheDir(), sessionName(SessionFileState::processing, i));
  flush();
  const auto names = entryNames(env.cacheDir());
  EXPECT_EQ(std::count_if(names.begin(), names.end(), [](const auto& n) { return n.starts_with("session."); }), 50);
  EXPECT_EQ(deletions(), (Pairs(51, {"FeedbackV2", kPruned})));  // typed by the upload format in the name
}

}  // namespace
}  // namespace fbf::testing
