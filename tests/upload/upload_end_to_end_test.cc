// Uploads through the real libcurl session to a real fbf-ingest over HTTPS on
// loopback, with a certificate made for the test.
#include "assembly/fbf_strings.h"
#include "platform/curl_http_session.h"
#include "support/test_support.h"
#include "upload/upload_manager.h"
#include "upload/upload_test_util.h"

#include "corevireon.pb.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/x509.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <condition_variable>
#include <fstream>
#include <thread>

extern char** environ;

namespace fbf {
namespace {

using namespace std::chrono_literals;

constexpr auto kWaitLimit = 60s;
constexpr const char* kSessionName = "session.77.0C4B7C2E-5A8B-4E8E-9C55-2C1DF3A01B6E.processing";

fs::path binDir() {
  if (const char* dir = std::getenv("FBF_BIN_DIR")) return dir;
  return FBF_DEFAULT_BIN_DIR;
}

// A key pair and self-signed certificate for 127.0.0.1, made once per run.
struct TestCertificate {
  testing::TempDir dir;
  fs::path cert = dir.path() / "cert.pem";
  fs::path key = dir.path() / "key.pem";
  bool made = false;

  TestCertificate() {
    std::string cmd =
        "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2"
        " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout '" +
        key.string() + "' -out '" + cert.string() + "' >/dev/null 2>&1";
    made = std::system(cmd.c_str()) == 0 && fs::exists(cert) && fs::exists(key);
  }

  // libcurl's pin of the certificate's key: "sha256//" + base64(SHA-256(SPKI)).
  std::string pin() const {
    FILE* f = std::fopen(cert.c_str(), "r");
    if (!f) return {};
    X509* x = PEM_read_X509(f, nullptr, nullptr, nullptr);
    std::fclose(f);
    if (!x) return {};
    unsigned char* der = nullptr;
    int len = i2d_PUBKEY(X509_get0_pubkey(x), &der);
    unsigned char md[32];
    unsigned int mdLen = 0;
    EVP_Digest(der, static_cast<size_t>(len), md, &mdLen, EVP_sha256(), nullptr);
    OPENSSL_free(der);
    X509_free(x);
    unsigned char b64[64] = {};
    EVP_EncodeBlock(b64, md, static_cast<int>(mdLen));
    return "sha256//" + std::string(reinterpret_cast<char*>(b64));
  }
};

TestCertificate& certificate() {
  static TestCertificate c;
  return c;
}

// One fbf-ingest process for the life of the object.
class Ingest {
 public:
  explicit Ingest(std::vector<std::string> extra) {
    recordFile_ = dir_.path() / "record.jsonl";
    auto portFile = dir_.path() / "port";
    std::vector<std::string> args = {(binDir() / "fbf-ingest").string(),
                                     "--listen",
                                     "127.0.0.1:0",
                                     "--tls",
                                     certificate().cert.string(),
                                     certificate().key.string(),
                                     "--record",
                                     recordFile_.string(),
                                     "--port-file",
                                     portFile.string()};
    args.insert(args.end(), extra.begin(), extra.end());
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    argv.push_back(nullptr);
    if (posix_spawn(&pid_, argv[0], nullptr, nullptr, argv.data(), environ) != 0) pid_ = -1;
    auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
    while (pid_ > 0 && std::chrono::steady_clock::now() < deadline) {
      std::ifstream in(portFile);
      if (in >> port_) break;
      std::this_thread::sleep_for(20ms);
    }
  }
  ~Ingest() {
    if (pid_ > 0) {
      kill(pid_, SIGTERM);
      int status = 0;
      waitpid(pid_, &status, 0);
    }
  }
  bool running() const { return pid_ > 0 && port_ > 0; }
  std::string url() const { return "https://127.0.0.1:" + std::to_string(port_) + "/feedback"; }
  std::vector<nlohmann::json> records() const {
    std::vector<nlohmann::json> out;
    std::ifstream in(recordFile_);
    for (std::string line; std::getline(in, line);) out.push_back(nlohmann::json::parse(line));
    return out;
  }

 private:
  testing::TempDir dir_;
  fs::path recordFile_;
  pid_t pid_ = -1;
  int port_ = 0;
};

// A loopback port nobody listens on.
int closedPort() {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  socklen_t len = sizeof addr;
  getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
  close(fd);
  return ntohs(addr.sin_port);
}

struct Outcome {
  std::optional<HttpResponse> response;
  std::optional<HttpError> error;
};

class UploadToIngest : public ::testing::Test, public UploadManagerDelegate {
 protected:
  UploadToIngest() : env(true) {}

  void SetUp() override {
    ASSERT_TRUE(certificate().made) << "the openssl command could not make a test certificate";
    env.httpSessionFactory = makeCurlHttpSession;
    env.defaults().setObject(FBFStrings::LinuxDefaults::UploadCAFile, certificate().cert.string());
  }

  void TearDown() override {
    // Let the session finish and invalidate, so its transaction is released.
    onQueue([&] { manager.reset(); });
    auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
    size_t open = 1;
    while (std::chrono::steady_clock::now() < deadline) {
      onQueue([&] { open = env.assembly().openTransactionCount(); });
      if (open == 0) break;
      std::this_thread::sleep_for(10ms);
    }
    EXPECT_EQ(open, 0u);
  }

  void uploadManagerDidUploadFile(const fs::path& file, long status) override {
    std::lock_guard l(m);
    delegateCalls.emplace_back(file, status);
    delegateCalled.notify_all();
  }

  void onQueue(const std::function<void()>& f) { env.assembly().workloop().sync(f); }

  void useEndpoint(const std::string& url) {
    env.writeBag({{"feedback_url", url}, {"crowdsourcing_url", url}});
  }

  void makeManager() {
    onQueue([&] {
      manager = std::make_unique<UploadManager>(env.assembly());
      manager->setDelegate(this);
    });
  }

  corevireon::CVClientSession session() {
    corevireon::CVClientSession s;
    s.set_agent("Scoutlume/3.1");
    s.set_countrycode("DE");
    auto* f = s.mutable_feedbacks()->add_items();
    f->set_queryid(5);
    f->set_type(24);
    return s;
  }

  std::optional<UploadRequest> prepareSession() {
    std::optional<UploadRequest> r;
    onQueue([&] { r = manager->uploadProtobufFeedback(session(), env.cacheDir() / kSessionName); });
    return r;
  }

  // Sends and waits (bounded) for the completion.
  std::optional<Outcome> send(UploadRequest request) {
    std::optional<Outcome> result;
    std::condition_variable cv;
    onQueue([&] {
      manager->enqueue(std::move(request),
                       [&](std::optional<HttpResponse> r, std::optional<HttpError> e) {
                         std::lock_guard l(m);
                         result = Outcome{std::move(r), std::move(e)};
                         cv.notify_all();
                       });
    });
    std::unique_lock l(m);
    cv.wait_for(l, kWaitLimit, [&] { return result.has_value(); });
    return result;
  }

  std::vector<nlohmann::json> lossEvents() {
    std::vector<nlohmann::json> out;
    for (auto& [name, payload] : env.analytics->events()) {
      if (name == "vireond.feedbackLoss") out.push_back(payload);
    }
    return out;
  }

  testing::TestEnvironment env;
  std::unique_ptr<UploadManager> manager;
  std::mutex m;
  std::vector<std::pair<fs::path, long>> delegateCalls;
  std::condition_variable delegateCalled;
};

// Guards against: a payload the receiver cannot decode or verify, a file kept
// after HTTP 200 or deleted after any other status, a retry sent with a digest
// it never computed, or a stale retry sent at all (all through real HTTPS).
TEST_F(UploadToIngest, OnlyAcceptedUploadsAreDeletedAndEachArrivesWhole) {
  Ingest ingest({"--status", "201", "204", "500", "200"});
  ASSERT_TRUE(ingest.running());
  env.writeBag({{"feedback_url", ingest.url()},
                {"crowdsourcing_url", ingest.url()},
                {"feedback_max_age_in_days", 3}});
  env.defaults().setObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys, certificate().pin());
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
  EXPECT_EQ(r["path"], "/feedback");
  EXPECT_EQ(r["query"],
            (nlohmann::json{
                {"key", "galleon5290"}, {"seed", "1"}, {"type", "FeedbackV2PB"}, {"v", "2"}}));
  EXPECT_EQ(r["headers"]["Content-Type"], "application/protobuf");
  EXPECT_EQ(r["headers"]["Content-Encoding"], "deflate");
  EXPECT_EQ(r["headers"]["User-Agent"],
            "vireond/1.0 (TestBox1,1; TestOS 1.0 1A100) vireon-fbf/test");
  EXPECT_EQ(r["body_size"], request->compressedSize);
  EXPECT_EQ(r["inflated_size"], request->uncompressedSize);
  EXPECT_EQ(r["digest_ok"], true);
  EXPECT_EQ(r["digest_kind"], "sha512");
  EXPECT_EQ(r["decoded"]["agent"], "Scoutlume/3.1");
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
    delegateCalled.wait_for(l, kWaitLimit, [&] { return !delegateCalls.empty(); });
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

// Guards against: a refused connection not cancelling the flush, or any
// failed transfer losing the file.
TEST_F(UploadToIngest, ARefusedConnectionCancelsTheFlushAndKeepsTheFile) {
  useEndpoint("https://127.0.0.1:" + std::to_string(closedPort()) + "/feedback");
  makeManager();
  auto request = prepareSession();
  ASSERT_TRUE(request);
  testing::LogCapture logs;
  auto outcome = send(*request);
  ASSERT_TRUE(outcome && outcome->error);
  EXPECT_EQ(outcome->error->code, HttpErrorCode::cannotConnectToHost);
  EXPECT_TRUE(env.assembly().isCancelled());
  EXPECT_TRUE(logs.contains("Device appears to be offline. Flush cancelled."));
  EXPECT_TRUE(fs::exists(request->fileURL));
  EXPECT_EQ(delegateCalls.back().second, 0);
}

TEST_F(UploadToIngest, ADroppedConnectionKeepsTheFileWithoutCancelling) {
  Ingest ingest({"--drop"});
  ASSERT_TRUE(ingest.running());
  useEndpoint(ingest.url());
  makeManager();
  auto request = prepareSession();
  ASSERT_TRUE(request);
  auto outcome = send(*request);
  ASSERT_TRUE(outcome && outcome->error);
  EXPECT_FALSE(env.assembly().isCancelled());
  EXPECT_TRUE(fs::exists(request->fileURL));
  EXPECT_EQ(ingest.records().size(), 1u);
}

// Guards against: feedback sent to a server whose key is not pinned or whose
// certificate is not trusted.
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
