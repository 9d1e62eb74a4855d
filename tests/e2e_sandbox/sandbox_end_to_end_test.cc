// The daemon under the service unit's system-call confinement: a whole
// flush over HTTPS on loopback must work with exactly the system calls,
// address families and memory rules packaging/vireon-fbf.service allows.
// fbf-unit-sandbox applies them with seccomp the way systemd does, so the
// test runs where no user manager is available.
#include "e2e/daemon_home.h"

namespace fbf::testing {
namespace {

// Guards against: a system call, address family or mapping the daemon needs but the service unit refuses.
TEST(SandboxedDaemon, FlushesEverythingUnderTheUnitsSystemCallFilter) {
#if defined(__SANITIZE_ADDRESS__)
  GTEST_SKIP() << "the sanitizer runtime needs calls the unit refuses (setrlimit); the release tree runs this";
#endif
  ASSERT_TRUE(LoopbackCertificate::get().made) << "openssl could not make a certificate";
  const char* source = std::getenv("FBF_SOURCE_DIR");
  ASSERT_NE(source, nullptr) << "FBF_SOURCE_DIR is not set";
  DaemonHome home;
  Receiver receiver(home.root());
  ASSERT_TRUE(receiver.running());
  home.configure(receiver.url());
  ASSERT_EQ(home.generate(8, 6, 17).status, 0);

  home.startDaemon({FBF_UNIT_SANDBOX, (fs::path(source) / "packaging" / "vireon-fbf.service").string(), "--"});
  ASSERT_NE(home.daemon(), nullptr);
  // Mode 2 is a seccomp filter; the sandbox is really in place.
  const auto status = readFile("/proc/" + std::to_string(home.daemon()->pid()) + "/status");
  ASSERT_NE(status.find("\nSeccomp:\t2\n"), std::string::npos) << status << home.daemonLog();

  auto flush = home.fbfctl({"flush"});
  ASSERT_EQ(flush.status, 0) << flush.err << home.daemonLog();
  auto records = receiver.records();
  EXPECT_EQ(delivered(records), records.size());
  EXPECT_GT(records.size(), 8u) << "the sessions and the custom feedback were sent";
  EXPECT_TRUE(home.sessionFiles().empty()) << ::testing::PrintToString(home.sessionFiles());
  EXPECT_TRUE(home.customFiles().empty()) << ::testing::PrintToString(home.customFiles());
  // A refused call would show up as a failure somewhere in the log.
  EXPECT_EQ(home.daemonLog().find("Operation not permitted"), std::string::npos) << home.daemonLog();
  EXPECT_EQ(home.stopDaemon(), 0) << home.daemonLog();
}

}  // namespace
}  // namespace fbf::testing
