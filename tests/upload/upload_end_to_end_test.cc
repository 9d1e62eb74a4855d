// Uploads through the real libcurl session to a real fbf-ingest over HTTPS on
// loopback, with a certificate made for the test.
#include "assembly/fbf_strings.h"
#include "platform/curl_http_session.h"
#include "support/process.h"
#include "support/test_support.h"
#include "upload/upload_manager.h"

#include "corevireon.pb.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <fstream>

namespace fbf {
namespace {

using namespace std::chrono_literals;
constexpr auto kWaitLimit = 60s;

// A self-signed certificate for 127.0.0.1, made once per run, and libcurl's
// pin of its key: "sha256//" + base64(SHA-256(SPKI)).
struct TestCertificate {
  testing::TempDir dir;
  std::string cert = (dir.path() / "cert.pem").string(), key = (dir.path() / "key.pem").string();
  std::string pin;
  TestCertificate() {
    auto sh = [](const std::string& cmd) {
      return testing::runProgram("/bin/sh", {"-c", cmd}, {});
    };
    sh("openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2 -subj "
       "/CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout " +
       key + " -out " + cert);
    auto spki = sh("openssl x509 -in " + cert +
                   " -pubkey -noout | openssl pkey -pubin -outform der"
                   " | openssl dgst -sha256 -binary | base64");
    if (spki.status == 0 && fs::exists(key)) pin = "sha256//" + spki.out.substr(0, 44);
  }
};

TestCertificate& certificate() {
  static TestCertificate c;
  return c;
}

// One fbf-ingest process for the life of the object.
class Ingest {
 public:
  explicit Ingest(std::vector<std::string> args) {
    auto portFile = dir_.path() / "port";
    args.insert(args.begin(),
                {"--listen", "127.0.0.1:0", "--tls", certificate().cert, certificate().key,
                 "--record", record_.string(), "--port-file", portFile.string()});
    process_.emplace(testing::binDir() / "fbf-ingest", args, std::map<std::string, std::string>{},
                     dir_.path() / "out", dir_.path() / "err");
    testing::waitUntil([&] { return bool(std::ifstream(portFile) >> port_); }, kWaitLimit);
  }
  bool running() const { return port_ > 0; }
  std::string url() const { return "https://127.0.0.1:" + std::to_string(port_) + "/feedback"; }
  std::vector<nlohmann::json> records() const {
    std::vector<nlohmann::json> out;
    std::ifstream in(record_);
    for (std::string line; std::getline(in, line);) out.push_back(nlohmann::json::parse(line));
    return out;
  }

 private:
  testing::TempDir dir_;
  fs::path record_ = dir_.path() / "record.jsonl";
  int port_ = 0;
  std::optional<testing::ChildProcess> process_;
};

struct Outcome {
  std::optional<HttpResponse> response;
  std::optional<HttpError> error;
};

class UploadToIngest : public ::testing::Test, public UploadManagerDelegate {
 protected:
  UploadToIngest() : env(true) {}

  void SetUp() override {
    ASSERT_FALSE(certificate().pin.empty()) << "openssl could not make a test certificate";
    env.httpSessionFactory = makeCurlHttpSession;
    env.defaults().setObject(FBFStrings::LinuxDefaults::UploadCAFile, certificate().cert);
  }
  void TearDown() override {
    // Let the session finish and invalidate, so its transaction is released.
    onQueue([&] { manager.reset(); });
    size_t open = 1;
    auto released = [&] {
      onQueue([&] { open = env.assembly().openTransactionCount(); });
      return open == 0;
    };
    testing::waitUntil(released, kWaitLimit);
    EXPECT_EQ(open, 0u);
  }
  void uploadManagerDidUploadFile(const fs::path& file, long status) override {
    std::lock_guard l(m);
    delegateCalls.emplace_back(file, status);
    done.notify_all();
  }
  void onQueue(const std::function<void()>& f) { env.assembly().workloop().sync(f); }
  void useEndpoint(const std::string& url) {
    env.writeBag(
        {{"feedback_url", url}, {"crowdsourcing_url", url}, {"feedback_max_age_in_days", 3}});
  }
  void makeManager() {
    onQueue([&] {
      manager = std::make_unique<UploadManager>(env.assembly());
      manager->setDelegate(this);
    });
  }
  std::optional<UploadRequest> prepareSession() {
    corevireon::CVClientSession s;
    s.set_agent("Scoutlume/3.1");
    s.set_countrycode("DE");
    s.mutable_feedbacks()->add_items()->set_queryid(5);
    std::optional<UploadRequest> r;
    onQueue([&] { r = manager->uploadProtobufFeedback(s, env.cacheDir() / kSessionName); });
    return r;
  }
  // Sends and waits (bounded) for the completion.
  std::optional<Outcome> send(UploadRequest request) {
    std::optional<Outcome> result;
    onQueue([&] {
      manager->enqueue(std::move(request), [&](auto r, auto e) {
        std::lock_guard l(m);
        result = Outcome{std::move(r), std::move(e)};
        done.notify_all();
      });
    });
    std::unique_lock l(m);
    done.wait_for(l, kWaitLimit, [&] { return result.has_value(); });
    return result;
  }
  std::vector<nlohmann::json> lossEvents() {
    std::vector<nlohmann::json> out;
    for (auto& [name, payload] : env.analytics->events()) {
      if (name == "vireond.feedbackLoss") out.push_back(payload);
    }
    return out;
  }

  static constexpr const char* kSessionName =
      "session.77.0C4B7C2E-5A8B-4E8E-9C55-2C1DF3A01B6E.processing";
  testing::TestEnvironment env;
  std::unique_ptr<UploadManager> manager;
  std::mutex m;
  std::condition_variable done;
  std::vector<std::pair<fs::path, long>> delegateCalls;
};

// Guards against: a payload kept after HTTP 200, lost after any other, or retried stale.
TEST_F(UploadToIngest, OnlyAcceptedUploadsAreDeletedAndEachArrivesWhole) {
  Ingest ingest({"--status", "201", "204", "500", "200"});
  ASSERT_TRUE(ingest.running());
  useEndpoint(ingest.url());
  env.defaults().setObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys, certificate().pin);
  makeManager();
  auto request = prepareSession();
  ASSERT_TRUE(request);
  for (long expected : {201L, 204L, 500L, 200L}) {
    auto outcome = send(*request);
    ASSERT_TRUE(outcome && outcome->response)
        << expected << (outcome && outcome->error ? outcome->error->description : "");
    EXPECT_EQ(outcome->response->statusCode, expected);
    EXPECT_EQ(fs::exists(request->fileURL), expected != 200);
    EXPECT_EQ(delegateCalls.back(), std::make_pair(request->fileURL, expected));
    EXPECT_EQ(lossEvents().size(), expected == 200 ? 1u : 0u);
  }
  EXPECT_FALSE(env.assembly().isCancelled());
  EXPECT_EQ(lossEvents().at(0)["reason"], 12);
  EXPECT_EQ(lossEvents().at(0)["feedbackType"], 13);
  auto records = ingest.records();
  ASSERT_EQ(records.size(), 4u);
  const auto& r = records[3];
  EXPECT_EQ(r["method"], "POST");
  EXPECT_EQ(r["query"], nlohmann::json::parse(R"({"key":"galleon5290","seed":"1",
                                                   "type":"FeedbackV2PB","v":"2"})"));
  for (auto [name, value] :
       {std::pair{"Content-Type", "application/protobuf"},
        {"Content-Encoding", "deflate"},
        {"User-Agent", "vireond/1.0 (TestBox1,1; TestOS 1.0 1A100) vireon-fbf/test"}}) {
    EXPECT_EQ(r["headers"][name], value) << name;
  }
  EXPECT_EQ(r["body_size"], request->compressedSize);
  EXPECT_EQ(r["inflated_size"], request->uncompressedSize);
  EXPECT_EQ(r["digest_ok"], true);
  EXPECT_EQ(r["digest_kind"], "sha512");
  EXPECT_EQ(r["decoded"]["countryCode"], "DE");

  // Custom feedback goes without Content-Type and decodes to the source.
  nlohmann::json report = {{"kind", "poi"}, {"notes", std::string(40000, 'n')}};
  auto source = env.cacheDir() / "CustomFeedback" / "Crowdsourcing" / "c-1";
  testing::writeFile(source, report.dump());
  std::optional<UploadRequest> custom;
  onQueue([&] { custom = manager->uploadCustomFeedback(source, "Crowdsourcing"); });
  ASSERT_TRUE(custom);
  auto outcome = send(*custom);
  ASSERT_TRUE(outcome && outcome->response);
  EXPECT_FALSE(fs::exists(custom->fileURL));
  records = ingest.records();
  ASSERT_EQ(records.size(), 5u);
  EXPECT_FALSE(records[4]["headers"].contains("Content-Type"));
  EXPECT_EQ(records[4]["decoded"], report);
  EXPECT_EQ(records[4]["digest_ok"], true);
  EXPECT_EQ(lossEvents().at(1)["feedbackType"], 2);

  // A later flush finds a file left pending and retries it, without a digest.
  request = prepareSession();
  ASSERT_TRUE(request);
  delegateCalls.clear();
  makeManager();
  onQueue([&] { manager->retryUpload(request->fileURL, "FeedbackV2PB"); });
  {
    std::unique_lock l(m);
    done.wait_for(l, kWaitLimit, [&] { return !delegateCalls.empty(); });
  }
  ASSERT_EQ(delegateCalls.size(), 1u);
  EXPECT_EQ(delegateCalls[0].second, 200);
  EXPECT_FALSE(fs::exists(request->fileURL));
  records = ingest.records();
  ASSERT_EQ(records.size(), 6u);
  EXPECT_EQ(records[5]["digest_kind"], "missing");
  EXPECT_EQ(records[5]["decoded"]["agent"], "Scoutlume/3.1");

  // One past its age limit is deleted unsent.
  request = prepareSession();
  ASSERT_TRUE(request);
  env.clock->set(env.fileManager->attributes(request->fileURL)->creationDate + 72h);
  makeManager();
  onQueue([&] { manager->retryUpload(request->fileURL, "FeedbackV2PB"); });
  EXPECT_FALSE(fs::exists(request->fileURL));
  ASSERT_EQ(lossEvents().size(), 4u);
  EXPECT_EQ(lossEvents()[3]["reason"], 1);
  EXPECT_EQ(lossEvents()[3]["age"], 72 * 3600);
  EXPECT_EQ(ingest.records().size(), 6u);
}

// Guards against: feedback sent to a server with an unpinned key or untrusted certificate.
TEST_F(UploadToIngest, AnUnpinnedOrUntrustedServerGetsNothing) {
  Ingest ingest({});
  ASSERT_TRUE(ingest.running());
  useEndpoint(ingest.url());
  for (bool pinned : {true, false}) {
    SCOPED_TRACE(pinned ? "wrong pin" : "untrusted certificate");
    if (pinned) {
      env.defaults().setObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys,
                               "sha256//AAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAA=");
    } else {
      env.defaults().removeObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys);
      env.defaults().removeObject(FBFStrings::LinuxDefaults::UploadCAFile);
    }
    makeManager();
    auto request = prepareSession();
    ASSERT_TRUE(request);
    auto outcome = send(*request);
    ASSERT_TRUE(outcome && outcome->error);
    EXPECT_EQ(outcome->error->code, HttpErrorCode::secureConnectionFailed);
    EXPECT_FALSE(env.assembly().isCancelled());
    EXPECT_TRUE(fs::exists(request->fileURL));
  }
  EXPECT_TRUE(ingest.records().empty());
}

// Guards against: an offline failure taken for a server fault or the reverse.
TEST(CurlErrorMapping, SortsOfflineFailuresFromTheRest) {
  EXPECT_EQ(httpErrorFromCurl(6, 0, "").code, HttpErrorCode::cannotFindHost);  // resolve
  EXPECT_EQ(httpErrorFromCurl(7, ECONNREFUSED, "").code,
            HttpErrorCode::cannotConnectToHost);  // connect
  EXPECT_EQ(httpErrorFromCurl(7, ENETUNREACH, "").code,
            HttpErrorCode::notConnectedToInternet);                                     // no route
  EXPECT_EQ(httpErrorFromCurl(90, 0, "").code, HttpErrorCode::secureConnectionFailed);  // pin
  EXPECT_EQ(httpErrorFromCurl(28, 0, "").code, HttpErrorCode::timedOut);
  EXPECT_EQ(httpErrorFromCurl(52, 0, "").domain, HttpErrorDomain::network);  // got nothing
  EXPECT_EQ(httpErrorFromCurl(27, 0, "").domain, HttpErrorDomain::other);    // out of memory
  EXPECT_EQ(httpErrorFromCurl(7, 0, "detail").description, "Couldn't connect to server: detail");
}

}  // namespace
}  // namespace fbf
