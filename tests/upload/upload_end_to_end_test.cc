// Uploads through the real libcurl session to a real fbf-ingest over HTTPS on
// loopback, with a certificate made for the test.
#include "assembly/fbf_strings.h"
#include "platform/curl_http_session.h"
#include "e2e/daemon_home.h"
#include "upload/upload_manager.h"

#include "corevireon.pb.h"

#include <condition_variable>

namespace fbf {
namespace {

using namespace std::chrono_literals;
constexpr auto kWaitLimit = 60s;

// libcurl's pin of the loopback certificate's key: "sha256//" + base64(SHA-256(SPKI)).
std::string certificatePin() {
  auto spki = testing::runProgram(
      "/bin/sh",
      {"-c", "openssl x509 -in '" + testing::LoopbackCertificate::get().cert.string() +
                 "' -pubkey -noout | openssl pkey -pubin -outform der"
                 " | openssl dgst -sha256 -binary | base64"},
      {});
  return spki.status == 0 ? "sha256//" + spki.out.substr(0, 44) : "";
}

class UploadToIngest : public ::testing::Test {
 protected:
  UploadToIngest() : env(true) {}

  void SetUp() override {
    ASSERT_FALSE(pin.empty()) << "openssl could not make a test certificate";
    env.httpSessionFactory = makeCurlHttpSession;
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
  void onQueue(const std::function<void()>& f) { env.assembly().workloop().sync(f); }
  // Sends and waits (bounded) for the completion: its error, if any.
  std::optional<std::optional<HttpError>> send(
      const std::function<std::optional<UploadRequest>()>& prepare) {
    std::optional<std::optional<HttpError>> result;
    onQueue([&] {
      manager = std::make_unique<UploadManager>(env.assembly());
      if (auto request = prepare()) {
        manager->enqueue(std::move(*request), [&](auto, auto e) {
          std::lock_guard l(m);
          result = std::move(e);
          done.notify_all();
        });
      }
    });
    std::unique_lock l(m);
    done.wait_for(l, kWaitLimit, [&] { return result.has_value(); });
    return result;
  }

  const std::string pin = certificatePin();
  testing::TestEnvironment env;
  std::unique_ptr<UploadManager> manager;
  std::mutex m;
  std::condition_variable done;
};

// Guards against: feedback sent to an unpinned or untrusted server, or refused or altered by a pinned one.
TEST_F(UploadToIngest, OnlyAPinnedTrustedServerGetsTheFeedbackWhole) {
  testing::Receiver ingest(env.temp.path());
  ASSERT_TRUE(ingest.running());
  env.writeBag({{"feedback_url", ingest.url()}, {"crowdsourcing_url", ingest.url()}});
  corevireon::CVClientSession session;
  session.mutable_feedbacks()->add_items()->set_queryid(5);
  const auto file = env.cacheDir() / "session.77.0C4B7C2E-5A8B-4E8E-9C55-2C1DF3A01B6E.processing";
  std::optional<UploadRequest> sent;
  auto prepareSession = [&] { return sent = manager->uploadProtobufFeedback(session, file); };
  for (std::string_view key : {"sha256//AAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAAA=", "", "pinned"}) {
    SCOPED_TRACE(key.empty() ? "untrusted certificate" : key);
    if (key.empty()) {  // neither pinned nor signed by a trusted authority
      env.defaults().removeObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys);
      env.defaults().removeObject(FBFStrings::LinuxDefaults::UploadCAFile);
    } else {
      env.defaults().setObject(FBFStrings::LinuxDefaults::UploadCAFile,
                               testing::LoopbackCertificate::get().cert.string());
      env.defaults().setObject(FBFStrings::LinuxDefaults::UploadPinnedPublicKeys,
                               std::string(key == "pinned" ? pin : key));
    }
    auto error = send(prepareSession);
    ASSERT_TRUE(error && sent);
    EXPECT_EQ(fs::exists(sent->fileURL), key != "pinned");
    EXPECT_EQ(error->has_value(), key != "pinned");
    if (*error) {
      EXPECT_EQ((*error)->code, HttpErrorCode::secureConnectionFailed);
    }
  }
  auto records = ingest.records();
  ASSERT_EQ(records.size(), 1u) << "only the pinned and trusted attempt may arrive";
  const auto& r = records[0];
  for (auto [name, value] :
       {std::pair{"Content-Type", "application/protobuf"},
        {"Content-Encoding", "deflate"},
        {"User-Agent", "vireond/1.0 (TestBox1,1; TestOS 1.0 1A100) vireon-fbf/test"}}) {
    EXPECT_EQ(r["headers"][name], value) << name;
  }
  EXPECT_EQ(r["body_size"], sent->compressedSize);
  EXPECT_EQ(r["inflated_size"], sent->uncompressedSize);
  EXPECT_EQ(r["digest_ok"], true);

  // Custom feedback goes without Content-Type (libcurl would add one).
  auto source = env.cacheDir() / "CustomFeedback" / "Crowdsourcing" / "c-1";
  testing::writeFile(source, "{}");
  auto error = send([&] { return manager->uploadCustomFeedback(source, "Crowdsourcing"); });
  ASSERT_TRUE(error && !*error);
  EXPECT_FALSE(fs::exists(source.string() + ".uploadPending"));
  records = ingest.records();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_FALSE(records[1]["headers"].contains("Content-Type"));
}

// Guards against: an offline failure taken for a server fault or the reverse.
TEST(CurlErrorMapping, SortsOfflineFailuresFromTheRest) {
  EXPECT_EQ(httpErrorFromCurl(6, 0, "").code, HttpErrorCode::cannotFindHost);  // resolve
  EXPECT_EQ(httpErrorFromCurl(7, ECONNREFUSED, "").code,
            HttpErrorCode::cannotConnectToHost);  // connect
  EXPECT_EQ(httpErrorFromCurl(7, ENETUNREACH, "").code,
            HttpErrorCode::notConnectedToInternet);                                     // no route
  EXPECT_EQ(httpErrorFromCurl(28, 0, "").code, HttpErrorCode::timedOut);
  EXPECT_EQ(httpErrorFromCurl(52, 0, "").domain, HttpErrorDomain::network);  // got nothing
  EXPECT_EQ(httpErrorFromCurl(27, 0, "").domain, HttpErrorDomain::other);    // out of memory
  EXPECT_EQ(httpErrorFromCurl(7, 0, "detail").description, "Couldn't connect to server: detail");
}

}  // namespace
}  // namespace fbf
