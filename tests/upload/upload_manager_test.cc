#include "upload/upload_manager.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"
#include "upload/upload_test_util.h"

#include "corevireon.pb.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

namespace fbf {
namespace {

using namespace std::chrono_literals;
using testing::inflateRawIndependently;
using testing::sha512Hex;

constexpr const char* kSessionName = "session.412.6F9619FF-8B86-D011-B42D-00C04FC964FF.processing";

// Answers as the test tells it to.
class FakeHttpSession final : public HttpClientSession {
 public:
  struct Task {
    HttpRequest request;
    fs::path body;
    HttpCompletion completion;
  };
  void uploadFile(HttpRequest request, fs::path body, HttpCompletion completion) override {
    tasks.push_back({std::move(request), std::move(body), std::move(completion)});
  }
  void finishTasksAndInvalidate() override { invalidated = true; }
  void cancelAllTasks() override {}

  std::vector<Task> tasks;
  bool invalidated = false;
};

class RecordingDelegate final : public UploadManagerDelegate {
 public:
  void uploadManagerDidUploadFile(const fs::path& file, long status) override { calls.emplace_back(file, status); }
  std::vector<std::pair<fs::path, long>> calls;
};

std::string queryOf(const HttpRequest& r) {
  auto q = r.url.find('?');
  return q == std::string::npos ? std::string() : r.url.substr(q + 1);
}

corevireon::CVClientSession sampleSession() {
  corevireon::CVClientSession session;
  session.set_agent("Wayfin/17.0");
  session.set_userguidstring("8E3B4C1A-0000-4000-8000-000000000001");
  session.set_countrycode("US");
  auto* feedback = session.mutable_feedbacks()->add_items();
  feedback->set_queryid(3);
  feedback->set_type(17);
  return session;
}

class UploadManagerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    env.httpSessionFactory = [this](HttpSessionConfiguration) {
      auto s = std::make_shared<FakeHttpSession>();
      sessions.push_back(s);
      return s;
    };
    env.writeBag({{"feedback_url", "https://feedback.example.net/upload"},
                  {"crowdsourcing_url", "https://crowd.example.net/in"}});
  }

  std::unique_ptr<UploadManager> makeManager(UploadBuildPredicates predicates = {}) {
    auto m = std::make_unique<UploadManager>(env.assembly(), std::move(predicates));
    m->setDelegate(&delegate);
    return m;
  }
  FakeHttpSession& session() { return *sessions.back(); }
  fs::path sessionURL() const { return env.cacheDir() / kSessionName; }
  fs::path uploadFile() const { return env.cacheDir() / (std::string(kSessionName) + ".pb.uploadPending"); }

  // A request whose body file exists, sent and answered as given.
  void sendAndAnswer(UploadManager& m, std::optional<HttpResponse> response, std::optional<HttpError> error,
                     const std::string& type = "FeedbackV2PB") {
    testing::writeFile(uploadFile(), "compressed");
    m.enqueue(UploadRequest{HttpRequest{}, uploadFile(), 10, 10, type, {}},
              [this](std::optional<HttpResponse> r, std::optional<HttpError> e) {
                completions.emplace_back(std::move(r), std::move(e));
              });
    ASSERT_FALSE(session().tasks.empty());
    session().tasks.back().completion(std::move(response), std::move(error));
    env.manualQueue->drain();
  }

  testing::TestEnvironment env;
  std::vector<std::shared_ptr<FakeHttpSession>> sessions;
  RecordingDelegate delegate;
  std::vector<std::pair<std::optional<HttpResponse>, std::optional<HttpError>>> completions;
};

// ---- request formation ----

TEST_F(UploadManagerTest, NormalProtobufRequestCarriesTheFixedItemsInNameOrder) {
  auto m = makeManager({[] { return true; }, [] { return false; }});
  auto r = m->feedbackUploadRequest("https://feedback.example.net/upload", "FeedbackV2PB");
  EXPECT_EQ(r.url, "https://feedback.example.net/upload?key=galleon5290&seed=1&type=FeedbackV2PB&v=2");
  EXPECT_EQ(r.method, "POST");
  EXPECT_EQ(r.timeout, 600s);
  EXPECT_TRUE(r.ignoreLocalCache);
  EXPECT_EQ(r.header("User-Agent"), env.assembly().deviceContext().userAgent());
  EXPECT_EQ(r.header("User-Agent"), "vireond/1.0 (TestBox1,1; TestOS 1.0 1A100) vireon-fbf/test");
  EXPECT_EQ(r.header("Content-Encoding"), "deflate");
}

TEST_F(UploadManagerTest, EveryOptionalItemSortsIntoPlace) {
  env.assembly().setFlushingEagerly(true);
  auto m = makeManager({[] { return true; }, [] { return true; }});
  auto r = m->feedbackUploadRequest("https://feedback.example.net/upload", "FeedbackV2PB");
  EXPECT_EQ(queryOf(r), "internal=1&key=galleon5290&realtime=1&seed=1&type=FeedbackV2PB&v=2");
}

TEST_F(UploadManagerTest, TheSeedItemComesFromTheBuildPredicate) {
  auto defaults = makeManager();
  EXPECT_NE(queryOf(defaults->feedbackUploadRequest("https://h.example/u", "FeedbackV2")).find("seed=1"),
            std::string::npos);
  auto noSeed = makeManager({[] { return false; }, [] { return false; }});
  EXPECT_EQ(queryOf(noSeed->feedbackUploadRequest("https://h.example/u", "")), "key=galleon5290&v=2");
}

TEST_F(UploadManagerTest, DebugParametersOverrideOnlyWellFormedPieces) {
  env.defaults().setObject(FBFStrings::Defaults::DebugQueryParameters, "v=3&foo&a=b=c&x=");
  auto m = makeManager({[] { return true; }, [] { return false; }});
  auto r = m->feedbackUploadRequest("https://feedback.example.net/upload", "FeedbackV2PB");
  EXPECT_EQ(queryOf(r), "key=galleon5290&seed=1&type=FeedbackV2PB&v=3");
}

TEST(DebugParameterParsing, KeepsExactlyTheTwoPartPieces) {
  EXPECT_EQ(UploadManager::debugQueryItems("v=3&foo&a=b=c&x="), (std::vector<QueryItem>{{"v", "3"}}));
  EXPECT_EQ(UploadManager::debugQueryItems("&&key=other&&seed=0"),
            (std::vector<QueryItem>{{"key", "other"}, {"seed", "0"}}));
  EXPECT_EQ(UploadManager::debugQueryItems("=b&a=&"), std::vector<QueryItem>{});
}

TEST_F(UploadManagerTest, ContentTypeIsAsymmetricByDesign) {
  auto m = makeManager();
  auto contentType = [&](const std::string& type) {
    return m->feedbackUploadRequest("https://h.example/u", type).header("Content-Type");
  };
  EXPECT_EQ(contentType("FeedbackV2PB"), "application/protobuf");
  EXPECT_EQ(contentType("feedbackv2pb"), std::nullopt);
  EXPECT_EQ(contentType("Usage"), "application/protobuf");
  EXPECT_EQ(contentType("usage"), "application/protobuf");
  EXPECT_EQ(contentType("USERREPORT"), "application/protobuf");
  EXPECT_EQ(contentType("Crowdsourcing"), std::nullopt);
  EXPECT_EQ(contentType("FeedbackV2"), std::nullopt);
}

TEST_F(UploadManagerTest, ABadEndpointIsRefusedNotFatal) {
  auto m = makeManager();
  EXPECT_THROW(m->feedbackUploadRequest("ftp://h.example/u", "FeedbackV2"), VireonURLRequestBuilder::URLError);
  EXPECT_THROW(m->feedbackUploadRequest("https://h.example/a b", "FeedbackV2"), VireonURLRequestBuilder::URLError);
}

// ---- preparations ----

TEST_F(UploadManagerTest, ProtobufSessionIsCompressedIntoItsUploadFile) {
  auto m = makeManager();
  auto session = sampleSession();
  auto request = m->uploadProtobufFeedback(session, sessionURL());
  ASSERT_TRUE(request);
  EXPECT_EQ(request->fileURL, uploadFile());
  EXPECT_EQ(request->typeString, "FeedbackV2PB");
  std::string bytes = session.SerializeAsString();
  auto compressed = testing::readFile(uploadFile());
  EXPECT_EQ(inflateRawIndependently(compressed), bytes);
  EXPECT_EQ(request->uncompressedSize, static_cast<int64_t>(bytes.size()));
  EXPECT_EQ(request->compressedSize, static_cast<int64_t>(compressed.size()));
  EXPECT_EQ(request->request.header("X-Corvane-Digest"), sha512Hex(bytes));
  EXPECT_EQ(request->request.header("Content-Type"), "application/protobuf");
  struct stat st {};
  ASSERT_EQ(stat(uploadFile().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(UploadManagerTest, KeepingFeedbackCopiesTheCompressedFile) {
  env.defaults().setObject(FBFStrings::Defaults::LeaveFeedbackAfterUpload, true);
  auto m = makeManager();
  ASSERT_TRUE(m->uploadProtobufFeedback(sampleSession(), sessionURL()));
  auto copy = env.cacheDir() / (std::string(kSessionName) + ".deflate");
  EXPECT_EQ(testing::readFile(copy), testing::readFile(uploadFile()));
}

TEST_F(UploadManagerTest, JSONSessionIsStreamedIntoTheCompressor) {
  auto m = makeManager();
  nlohmann::ordered_json session = {{"user_guid", "x"}, {"feedbacks", {{{"queryId", 1}}, {{"queryId", 2}}}}};
  auto request = m->uploadJSONFeedback(session, env.cacheDir() / "session.7.6F9619FF-8B86-D011-B42D-00C04FC964FF.processing");
  ASSERT_TRUE(request);
  EXPECT_EQ(request->fileURL.filename(), "session.7.6F9619FF-8B86-D011-B42D-00C04FC964FF.processing.json.uploadPending");
  EXPECT_EQ(inflateRawIndependently(testing::readFile(request->fileURL)), session.dump());
  EXPECT_EQ(request->request.header("X-Corvane-Digest"), sha512Hex(session.dump()));
  EXPECT_EQ(request->request.header("Content-Type"), std::nullopt);
  EXPECT_NE(request->request.url.find("type=FeedbackV2&"), std::string::npos);
}

TEST_F(UploadManagerTest, JSONThatIsNotTextIsRefusedAndLeavesNoFile) {
  testing::LogCapture logs;
  auto m = makeManager();
  nlohmann::ordered_json session = {{"title", std::string("bad\xFF")}};
  EXPECT_FALSE(m->uploadJSONFeedback(session, sessionURL()));
  EXPECT_FALSE(fs::exists(env.cacheDir() / (std::string(kSessionName) + ".json.uploadPending")));
}

TEST_F(UploadManagerTest, WithoutABagNothingIsPreparedAndNoFileIsLeft) {
  fs::remove(env.cacheDir() / "bag.plist");
  testing::LogCapture logs;
  auto m = makeManager();
  EXPECT_FALSE(m->uploadProtobufFeedback(sampleSession(), sessionURL()));
  EXPECT_TRUE(logs.contains("feedback uploader found no upload endpoint from defaults."));
  EXPECT_FALSE(fs::exists(uploadFile()));
}

TEST_F(UploadManagerTest, AnUnparseableSessionNameGetsNoUploadFile) {
  testing::LogCapture logs;
  auto m = makeManager();
  EXPECT_FALSE(m->uploadProtobufFeedback(sampleSession(), env.cacheDir() / "not-a-session"));
  EXPECT_TRUE(logs.contains("Error getting temp file."));
}

TEST_F(UploadManagerTest, ANonHttpEndpointLeavesNoCompressedCopy) {
  env.writeBag({{"feedback_url", "ftp://feedback.example.net/upload"}});
  testing::LogCapture logs;
  auto m = makeManager();
  EXPECT_FALSE(m->canFormRequest("FeedbackV2PB"));
  EXPECT_FALSE(m->uploadProtobufFeedback(sampleSession(), sessionURL()));
  EXPECT_TRUE(logs.contains("feedbackUploadRequest failed because of bad url."));
  EXPECT_FALSE(fs::exists(uploadFile()));
  for (const auto& e : fs::directory_iterator(env.cacheDir())) {
    EXPECT_FALSE(e.path().filename().string().ends_with(".partial")) << e.path();
  }
}

TEST_F(UploadManagerTest, CustomFeedbackIsCompressedBesideItsSource) {
  auto source = env.cacheDir() / "CustomFeedback" / "Crowdsourcing" / "report-1";
  std::string content = testing::compressibleText(30000);
  testing::writeFile(source, content);
  auto m = makeManager();
  auto request = m->uploadCustomFeedback(source, "Crowdsourcing");
  ASSERT_TRUE(request);
  fs::path expected = source;
  expected += ".uploadPending";
  EXPECT_EQ(request->fileURL, expected);
  EXPECT_EQ(inflateRawIndependently(testing::readFile(expected)), content);
  EXPECT_EQ(request->uncompressedSize, 30000);
  EXPECT_EQ(request->typeString, "Crowdsourcing");
  // Crowdsourcing has its own endpoint when the bag names one.
  EXPECT_EQ(request->request.url.rfind("https://crowd.example.net/in?", 0), 0u);
  EXPECT_EQ(request->request.header("Content-Type"), std::nullopt);

  auto usage = env.cacheDir() / "CustomFeedback" / "Usage" / "u-1";
  testing::writeFile(usage, "\x0a\x02\x08\x01");
  auto usageRequest = m->uploadCustomFeedback(usage, "Usage");
  ASSERT_TRUE(usageRequest);
  EXPECT_EQ(usageRequest->request.url.rfind("https://feedback.example.net/upload?", 0), 0u);
  EXPECT_EQ(usageRequest->request.header("Content-Type"), "application/protobuf");
}

TEST_F(UploadManagerTest, CustomFeedbackOfAnUnknownTypeOrWithoutEndpointIsRefused) {
  auto source = env.cacheDir() / "CustomFeedback" / "Mystery" / "m-1";
  testing::writeFile(source, "data");
  testing::LogCapture logs;
  auto m = makeManager();
  EXPECT_FALSE(m->uploadCustomFeedback(source, "Mystery"));
  EXPECT_EQ(logs.count("Feedback endpoint or appropriate type not set, data can't be sent to server."), 1u);
  fs::remove(env.cacheDir() / "bag.plist");
  auto noBag = makeManager();
  EXPECT_FALSE(noBag->uploadCustomFeedback(source, "UserReport"));
  EXPECT_EQ(logs.count("Feedback endpoint or appropriate type not set, data can't be sent to server."), 2u);
}

TEST_F(UploadManagerTest, ALinkedCustomFileIsNeverRead) {
  auto secret = env.temp.path() / "outside";
  testing::writeFile(secret, "not for upload");
  auto link = env.cacheDir() / "CustomFeedback" / "UserReport" / "r-1";
  fs::create_directories(link.parent_path());
  fs::create_symlink(secret, link);
  testing::LogCapture logs;
  auto m = makeManager();
  EXPECT_FALSE(m->uploadCustomFeedback(link, "UserReport"));
  fs::path pending = link;
  pending += ".uploadPending";
  EXPECT_FALSE(fs::exists(pending));
}

// ---- outcomes ----

TEST_F(UploadManagerTest, Status200DeletesTheFileAndReportsItUploaded) {
  auto m = makeManager();
  testing::LogCapture logs;
  sendAndAnswer(*m, HttpResponse{200, {}}, std::nullopt);
  EXPECT_FALSE(fs::exists(uploadFile()));
  ASSERT_EQ(env.analytics->events().size(), 1u);
  EXPECT_EQ(env.analytics->events()[0].first, "vireond.feedbackLoss");
  EXPECT_EQ(env.analytics->events()[0].second["reason"], 12);
  EXPECT_EQ(env.analytics->events()[0].second["feedbackType"], 13);
  EXPECT_EQ(delegate.calls, (std::vector<std::pair<fs::path, long>>{{uploadFile(), 200}}));
  ASSERT_EQ(completions.size(), 1u);
  EXPECT_EQ(completions[0].first->statusCode, 200);
  EXPECT_TRUE(logs.contains("FeedbackV2PB upload completed successfully"));
}

TEST_F(UploadManagerTest, OtherStatusesKeepTheFile) {
  auto m = makeManager();
  for (long status : {201L, 204L, 500L}) {
    testing::LogCapture logs;
    sendAndAnswer(*m, HttpResponse{status, {}}, std::nullopt);
    EXPECT_TRUE(fs::exists(uploadFile())) << status;
    EXPECT_TRUE(logs.contains("FeedbackV2PB upload failed with non-200 response code"));
    EXPECT_EQ(delegate.calls.back().second, status);
  }
  EXPECT_TRUE(env.analytics->events().empty());
  EXPECT_FALSE(env.assembly().isCancelled());
}

TEST_F(UploadManagerTest, OfflineErrorsCancelTheFlushAndKeepTheFile) {
  auto m = makeManager();
  for (auto code : {HttpErrorCode::notConnectedToInternet, HttpErrorCode::dnsLookupFailed,
                    HttpErrorCode::cannotConnectToHost, HttpErrorCode::cannotFindHost}) {
    env.assembly().setCancelled(false);
    testing::LogCapture logs;
    sendAndAnswer(*m, std::nullopt, HttpError{HttpErrorDomain::url, code, "refused"});
    EXPECT_TRUE(env.assembly().isCancelled());
    EXPECT_TRUE(logs.contains("Device appears to be offline. Flush cancelled."));
    EXPECT_TRUE(logs.contains("FeedbackV2PB upload failed: refused"));
    EXPECT_TRUE(fs::exists(uploadFile()));
    EXPECT_EQ(delegate.calls.back().second, 0);
  }
}

TEST_F(UploadManagerTest, OtherNetworkErrorsKeepTheFileWithoutCancelling) {
  auto m = makeManager();
  sendAndAnswer(*m, std::nullopt, HttpError{HttpErrorDomain::url, HttpErrorCode::secureConnectionFailed, "pin"});
  sendAndAnswer(*m, std::nullopt, HttpError{HttpErrorDomain::network, HttpErrorCode::other, "reset"});
  EXPECT_FALSE(env.assembly().isCancelled());
  EXPECT_TRUE(fs::exists(uploadFile()));
  EXPECT_EQ(delegate.calls.size(), 2u);
  ASSERT_EQ(completions.size(), 2u);
  EXPECT_EQ(completions[1].second->description, "reset");
}

TEST_F(UploadManagerTest, AForeignErrorWithStatus200CountsAsSuccess) {
  auto m = makeManager();
  sendAndAnswer(*m, HttpResponse{200, {}}, HttpError{HttpErrorDomain::other, HttpErrorCode::other, "odd"});
  EXPECT_FALSE(fs::exists(uploadFile()));
  EXPECT_EQ(env.analytics->events().size(), 1u);
}

TEST_F(UploadManagerTest, NoResponseAndNoErrorReportsStatusZero) {
  auto m = makeManager();
  sendAndAnswer(*m, std::nullopt, std::nullopt);
  EXPECT_TRUE(fs::exists(uploadFile()));
  EXPECT_EQ(delegate.calls.back().second, 0);
}

TEST_F(UploadManagerTest, CompletionsAfterTheManagerIsGoneStillApplyTheRules) {
  auto m = makeManager();
  testing::writeFile(uploadFile(), "compressed");
  m->enqueue(UploadRequest{HttpRequest{}, uploadFile(), 1, 1, "FeedbackV2PB", {}}, nullptr);
  auto pending = std::move(session().tasks.back().completion);
  m.reset();
  EXPECT_TRUE(session().invalidated);
  pending(HttpResponse{200, {}}, std::nullopt);
  env.manualQueue->drain();
  EXPECT_FALSE(fs::exists(uploadFile()));
  EXPECT_TRUE(delegate.calls.empty());
}

// ---- retry ----

class UploadRetryTest : public UploadManagerTest {
 protected:
  fs::path pendingFile() {
    auto f = env.cacheDir() / "CustomFeedback" / "UserReport" / "r-9.uploadPending";
    testing::writeFile(f, std::string(1500, 'z'));
    return f;
  }
  SystemTime createdAt(const fs::path& f) { return env.fileManager->attributes(f)->creationDate; }
};

TEST_F(UploadRetryTest, WithoutABagTheLimitIsSevenDays) {
  fs::remove(env.cacheDir() / "bag.plist");
  auto f = pendingFile();
  auto m = makeManager();
  testing::LogCapture logs;
  env.clock->set(createdAt(f) + 24h * 6 + 23h);
  m->retryUpload(f, "UserReport");
  // Young enough: it would be re-sent, but there is no endpoint without a bag.
  EXPECT_TRUE(logs.contains("feedback uploader found no upload endpoint from defaults."));
  EXPECT_TRUE(fs::exists(f));
  EXPECT_TRUE(env.analytics->events().empty());

  env.clock->set(createdAt(f) + 24h * 7);
  m->retryUpload(f, "UserReport");
  EXPECT_FALSE(fs::exists(f));
  EXPECT_TRUE(logs.contains("Discarding rather than retrying upload because file is too old: r-9.uploadPending."));
  ASSERT_EQ(env.analytics->events().size(), 1u);
  auto payload = env.analytics->events()[0].second;
  EXPECT_EQ(payload["reason"], 1);
  EXPECT_EQ(payload["feedbackType"], 10);
  EXPECT_EQ(payload["size"], 2);
  EXPECT_EQ(payload["age"], 7 * 86400);
}

TEST_F(UploadRetryTest, AYoungFileIsResentWithoutDigestAndWithZeroSizes) {
  env.writeBag({{"feedback_url", "https://feedback.example.net/upload"}, {"feedback_max_age_in_days", 2}});
  auto f = pendingFile();
  auto m = makeManager();
  env.clock->set(createdAt(f) + 47h);
  m->retryUpload(f, "UserReport");
  ASSERT_EQ(session().tasks.size(), 1u);
  EXPECT_EQ(session().tasks[0].body, f);
  EXPECT_EQ(session().tasks[0].request.header("X-Corvane-Digest"), std::nullopt);
  EXPECT_EQ(session().tasks[0].request.header("Content-Type"), "application/protobuf");
  EXPECT_NE(session().tasks[0].request.url.find("type=UserReport"), std::string::npos);

  env.clock->set(createdAt(f) + 48h);
  m->retryUpload(f, "UserReport");
  EXPECT_EQ(session().tasks.size(), 1u);
  EXPECT_FALSE(fs::exists(f));
}

TEST_F(UploadRetryTest, AFileWithoutAttributesCountsAsTooOld) {
  auto m = makeManager();
  testing::LogCapture logs;
  m->retryUpload(env.cacheDir() / "gone.uploadPending", "FeedbackV2");
  EXPECT_TRUE(logs.contains("error removing session file"));
  EXPECT_TRUE(env.analytics->events().empty());
}

TEST(UploadAgeRule, IsStrictAndSurvivesAbsurdBagValues) {
  SystemTime t0{};
  struct Row {
    const char* name;
    int64_t days;
    SystemTime creation, now;
    bool allowed;
  };
  const Row rows[] = {
      {"just young enough", 1, t0, t0 + 86399s, true},
      {"exactly the limit", 1, t0, t0 + 86400s, false},
      {"from the future", 1, t0 + 10s, t0, true},
      {"zero days: everything is too old", 0, t0, t0, false},
      // Too large to count in seconds: no limit rather than a crash.
      {"overflowing means no limit", INT64_MAX / 1000, t0, t0 + 100000 * 86400s, true},
  };
  for (const auto& r : rows) {
    EXPECT_EQ(FeedbackAgeLimit::fromDays(r.days).allows(r.creation, r.now), r.allowed) << r.name;
  }
}

}  // namespace
}  // namespace fbf
