#include "upload/upload_manager.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"
#include "upload/upload_test_util.h"

#include "corevireon.pb.h"

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr std::string_view kSessionName =
    "session.412.6F9619FF-8B86-D011-B42D-00C04FC964FF.processing";

corevireon::CVClientSession sampleSession() {
  corevireon::CVClientSession session;
  session.set_countrycode("US");
  session.mutable_feedbacks()->add_items()->set_queryid(3);
  return session;
}

class UploadManagerTest : public ::testing::Test, public UploadManagerDelegate {
 protected:
  void SetUp() override {
    env.httpSessionFactory = [this](HttpSessionConfiguration c) {
      sessions.push_back(std::make_shared<FakeHttpSession>(std::move(c)));
      return sessions.back();
    };
    env.writeBag({{"feedback_url", "https://feedback.example.net/upload"},
                  {"crowdsourcing_url", "https://crowd.example.net/in"}});
  }
  void uploadManagerDidUploadFile(const fs::path& file, long status) override {
    calls.emplace_back(file, status);
  }
  std::unique_ptr<UploadManager> makeManager(UploadBuildPredicates predicates = {}) {
    auto m = std::make_unique<UploadManager>(env.assembly(), std::move(predicates));
    m->setDelegate(this);
    return m;
  }
  FakeHttpSession& session() { return *sessions.back(); }
  fs::path cached(std::string_view name) const { return env.cacheDir() / std::string(name); }
  fs::path sessionURL() const { return cached(kSessionName); }
  fs::path uploadFile() const { return cached(std::string(kSessionName) + ".pb.uploadPending"); }
  HttpRequest requestFor(std::string type, UploadBuildPredicates predicates = {}) {
    return makeManager(std::move(predicates))->feedbackUploadRequest("https://h.example/u", type);
  }

  TestEnvironment env;
  LogCapture logs;
  std::vector<std::shared_ptr<FakeHttpSession>> sessions;
  std::vector<std::pair<fs::path, long>> calls;
};

// Guards against: an upload request with wrong query items, order or headers.
TEST_F(UploadManagerTest, RequestsCarryTheirItemsInNameOrderAndTheRightHeaders) {
  auto yes = [] { return true; };
  auto no = [] { return false; };
  auto r = requestFor("FeedbackV2PB", {yes, no});
  EXPECT_EQ(r.url, "https://h.example/u?key=galleon5290&seed=1&type=FeedbackV2PB&v=2");
  EXPECT_EQ(r.method, "POST");
  EXPECT_EQ(requestFor("", {no, no}).url, "https://h.example/u?key=galleon5290&v=2");
  env.assembly().setFlushingEagerly(true);
  EXPECT_EQ(requestFor("Usage", {yes, yes}).url,
            "https://h.example/u?internal=1&key=galleon5290&realtime=1&seed=1&type=Usage&v=2");
  env.assembly().setFlushingEagerly(false);
  env.defaults().setObject(FBFStrings::Defaults::DebugQueryParameters,
                           "v=3&foo&a=b=c&x=&=b&&seed=0");
  EXPECT_EQ(requestFor("Usage", {yes, no}).url,
            "https://h.example/u?key=galleon5290&seed=0&type=Usage&v=3");

  const std::pair<const char*, bool> protobufTypes[] = {
      {"FeedbackV2PB", true}, {"feedbackv2pb", false},  {"Usage", true},      {"usage", true},
      {"USERREPORT", true},   {"Crowdsourcing", false}, {"FeedbackV2", false}};
  auto m = makeManager();
  for (auto [type, protobuf] : protobufTypes) {
    EXPECT_EQ(m->feedbackUploadRequest("https://h.example/u", type).header("Content-Type"),
              protobuf ? std::optional<std::string>("application/protobuf") : std::nullopt)
        << type;
  }
  EXPECT_THROW(m->feedbackUploadRequest("https://h.example/a b", "FeedbackV2"),
               VireonURLRequestBuilder::URLError);
}

// Guards against: an upload file that does not hold the payload, or one left after a refusal.
using UploadPreparation = UploadManagerTest;

TEST_F(UploadPreparation, SessionsAreCompressedIntoOwnerOnlyUploadFilesWithTheirDigest) {
  env.defaults().setObject(FBFStrings::Defaults::LeaveFeedbackAfterUpload, true);
  auto request = makeManager()->uploadProtobufFeedback(sampleSession(), sessionURL());
  ASSERT_TRUE(request);
  EXPECT_EQ(request->fileURL, uploadFile());
  auto compressed = readFile(uploadFile());
  EXPECT_EQ(inflateRawIndependently(compressed), sampleSession().SerializeAsString());
  EXPECT_EQ(env.fileManager->attributes(uploadFile())->mode, 0600u);
  // Kept feedback: a copy of the compressed file beside the session.
  EXPECT_EQ(readFile(cached(std::string(kSessionName) + ".deflate")), compressed);

  // JSON is streamed into the compressor and sent without a Content-Type; a
  // write larger than the compressor's staging buffer would be digested twice.
  nlohmann::ordered_json json = {{"user_guid", "x"}, {"feedbacks", nlohmann::json::array()}};
  for (int i = 0; i < 500; ++i) json["feedbacks"].push_back({{"queryId", i}, {"rank", i % 7}});
  request = makeManager()->uploadJSONFeedback(json, sessionURL());
  ASSERT_TRUE(request);
  EXPECT_EQ(request->fileURL, cached(std::string(kSessionName) + ".json.uploadPending"));
  EXPECT_EQ(inflateRawIndependently(readFile(request->fileURL)), json.dump());
  EXPECT_LT(request->compressedSize, request->uncompressedSize / 4);
  EXPECT_EQ(request->request.header("X-Corvane-Digest"), sha512Hex(json.dump()));
  EXPECT_EQ(request->request.header("Content-Type"), std::nullopt);
  EXPECT_NE(request->request.url.find("type=FeedbackV2&"), std::string::npos);
}

TEST_F(UploadPreparation, CustomFeedbackIsCompressedBesideItsSourceForItsEndpoint) {
  auto m = makeManager();
  auto source = cached("CustomFeedback/Crowdsourcing/report-1");
  writeFile(source, "report");
  auto request = m->uploadCustomFeedback(source, "Crowdsourcing");
  ASSERT_TRUE(request);
  EXPECT_EQ(request->fileURL, cached("CustomFeedback/Crowdsourcing/report-1.uploadPending"));
  // Crowdsourcing has its own endpoint when the bag names one.
  EXPECT_EQ(request->request.url.rfind("https://crowd.example.net/in?", 0), 0u);
  EXPECT_EQ(request->request.header("Content-Type"), std::nullopt);

  auto usage = cached("CustomFeedback/Usage/u-1");
  writeFile(usage, "\x0a\x02\x08\x01");
  auto usageRequest = m->uploadCustomFeedback(usage, "Usage");
  ASSERT_TRUE(usageRequest);
  EXPECT_EQ(usageRequest->request.url.rfind("https://feedback.example.net/upload?", 0), 0u);
}

TEST_F(UploadPreparation, EachRefusalIsLoggedAndLeavesNoUploadFile) {
  nlohmann::ordered_json notText = {{"title", std::string("bad\xFF")}};
  EXPECT_FALSE(makeManager()->uploadJSONFeedback(notText, sessionURL()));
  EXPECT_FALSE(makeManager()->uploadProtobufFeedback(sampleSession(), cached("not-a-session")));
  EXPECT_TRUE(logs.contains("Error getting temp file."));
  const std::string refused =
      "Feedback endpoint or appropriate type not set, data can't be sent to server.";
  auto mystery = cached("CustomFeedback/Mystery/m-1");
  writeFile(mystery, "data");
  EXPECT_FALSE(makeManager()->uploadCustomFeedback(mystery, "Mystery"));
  EXPECT_EQ(logs.count(refused), 1u);
  auto link = cached("CustomFeedback/UserReport/r-1");  // never read through
  writeFile(env.temp.path() / "outside", "not for upload");
  fs::create_directories(link.parent_path());
  fs::create_symlink(env.temp.path() / "outside", link);
  EXPECT_FALSE(makeManager()->uploadCustomFeedback(link, "UserReport"));

  env.writeBag({{"feedback_url", "ftp://h.example/u"}});
  auto m = makeManager();
  EXPECT_FALSE(m->uploadProtobufFeedback(sampleSession(), sessionURL()));
  EXPECT_TRUE(logs.contains("feedbackUploadRequest failed because of bad url."));
  for (const auto& e : fs::recursive_directory_iterator(env.cacheDir())) {
    EXPECT_TRUE(e.path() == mystery || e.path() == link || e.path().filename() == "bag.plist" ||
                e.is_directory())
        << e.path();
  }
}

// Guards against: a file deleted on anything but HTTP 200, or a wrong offline verdict.
using UploadOutcome = UploadManagerTest;

TEST_F(UploadOutcome, OnlyStatus200DeletesTheFileAndOnlyOfflineErrorsCancel) {
  using Code = HttpErrorCode;
  struct Row {
    const char* name;
    std::optional<long> status = {};
    std::optional<HttpError> error = {};
    bool deleted = false, cancelled = false;
    const char* log = "";
  };
  auto url = [](Code c) { return HttpError{HttpErrorDomain::url, c, "refused"}; };
  const char* offline = "Device appears to be offline. Flush cancelled.";
  const Row rows[] = {
      {"200", 200, {}, true, false, "FeedbackV2PB upload completed successfully"},
      {"201", 201, {}, false, false, "FeedbackV2PB upload failed with non-200 response code"},
      {"204", 204},
      {"no network", {}, url(Code::notConnectedToInternet), false, true, offline},
      {"no DNS", {}, url(Code::dnsLookupFailed), false, true, offline},
      {"no host", {}, url(Code::cannotFindHost), false, true, offline},
      {"pinning failed", {}, url(Code::secureConnectionFailed), false, false, "FeedbackV2PB upload failed: refused"},
      {"connection reset", {}, HttpError{HttpErrorDomain::network, Code::other, "reset"}},
      {"a foreign error with 200", 200, HttpError{HttpErrorDomain::other, Code::other, "odd"}, true},
      {"neither response nor error", {}, {}},
  };
  auto m = makeManager();
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    LogCapture rowLogs;
    env.assembly().setCancelled(false);
    auto events = env.analytics->events().size();
    writeFile(uploadFile(), "compressed");
    std::optional<std::optional<HttpError>> completed;
    m->enqueue(UploadRequest{HttpRequest{}, uploadFile(), 10, 10, "FeedbackV2PB", {}},
               [&](std::optional<HttpResponse>, std::optional<HttpError> e) { completed = e; });
    EXPECT_EQ(m->uploadsInFlight(), 1u);
    std::optional<HttpResponse> response;
    if (row.status) response = HttpResponse{*row.status, {}};
    session().tasks.back().completion(response, row.error);
    env.manualQueue->drain();
    EXPECT_EQ(m->uploadsInFlight(), 0u);
    EXPECT_EQ(fs::exists(uploadFile()), !row.deleted);
    EXPECT_EQ(env.assembly().isCancelled(), row.cancelled);
    EXPECT_EQ(calls.back(), std::make_pair(uploadFile(), row.status.value_or(0)));
    ASSERT_TRUE(completed);
    EXPECT_EQ(completed->has_value(), row.error.has_value());
    EXPECT_TRUE(rowLogs.contains(row.log));
    EXPECT_EQ(rowLogs.contains(offline), row.cancelled);
    ASSERT_EQ(env.analytics->events().size(), events + row.deleted);
    if (row.deleted) {
      EXPECT_EQ(env.analytics->events().back().first, "vireond.feedbackLoss");
      EXPECT_EQ(env.analytics->events().back().second["reason"], 12);
      EXPECT_EQ(env.analytics->events().back().second["feedbackType"], 13);
    }
  }
  EXPECT_EQ(calls.size(), std::size(rows));
}

TEST_F(UploadOutcome, CompletionsAfterTheManagerIsGoneStillApplyTheRules) {
  auto m = makeManager();
  writeFile(uploadFile(), "compressed");
  m->enqueue(UploadRequest{HttpRequest{}, uploadFile(), 1, 1, "FeedbackV2PB", {}}, nullptr);
  auto pending = std::move(session().tasks.back().completion);
  m.reset();
  pending(HttpResponse{200, {}}, std::nullopt);
  env.manualQueue->drain();
  EXPECT_FALSE(fs::exists(uploadFile()));
  EXPECT_TRUE(calls.empty());
}

// Guards against: a stale upload retried, or a young one dropped or resent with a digest.
using UploadRetry = UploadManagerTest;

TEST_F(UploadRetry, AStaleFileIsDroppedAndReportedAYoungOneResentWithoutDigest) {
  const auto f = cached("CustomFeedback/UserReport/r-9.uploadPending");
  auto retryAt = [&](std::chrono::hours age) {
    env.clock->set(env.fileManager->attributes(f)->creationDate + age);
    makeManager()->retryUpload(f, "UserReport");
  };
  fs::remove(cached("bag.plist"));
  writeFile(f, std::string(1500, 'z'));
  retryAt(24h * 6 + 23h);
  // Young enough: it would be re-sent, but there is no endpoint without a bag.
  EXPECT_TRUE(logs.contains("feedback uploader found no upload endpoint from defaults."));
  EXPECT_TRUE(fs::exists(f));
  EXPECT_TRUE(env.analytics->events().empty());

  retryAt(24h * 7);
  EXPECT_FALSE(fs::exists(f));
  EXPECT_TRUE(logs.contains(
      "Discarding rather than retrying upload because file is too old: r-9.uploadPending."));
  ASSERT_EQ(env.analytics->events().size(), 1u);
  EXPECT_EQ(env.analytics->events()[0].second,
            (nlohmann::json{{"feedbackType", 10}, {"reason", 1}, {"size", 2}, {"age", 7 * 86400}}));

  makeManager()->retryUpload(cached("gone.uploadPending"), "FeedbackV2");
  EXPECT_TRUE(logs.contains("error removing session file"));
  EXPECT_EQ(env.analytics->events().size(), 1u);

  // With a bag: its limit, and a young file is resent without a digest.
  env.writeBag({{"feedback_url", "https://h.example/u"}, {"feedback_max_age_in_days", 2}});
  writeFile(f, std::string(1500, 'z'));
  retryAt(47h);
  ASSERT_EQ(session().tasks.size(), 1u);
  EXPECT_EQ(session().tasks[0].request.header("X-Corvane-Digest"), std::nullopt);
  EXPECT_NE(session().tasks[0].request.url.find("type=UserReport"), std::string::npos);
  retryAt(48h);
  EXPECT_EQ(session().tasks.size(), 0u);
  EXPECT_FALSE(fs::exists(f));
}

}  // namespace
}  // namespace fbf::testing
