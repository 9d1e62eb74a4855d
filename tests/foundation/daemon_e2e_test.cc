#include "support/process.h"
#include "support/test_support.h"

#include <signal.h>
#include <sys/stat.h>

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

// Guards against: the daemon ending on SIGTERM or SIGINT without its log line and a clean exit, or a socket others can use.
class DaemonSignals : public ::testing::TestWithParam<int> {};

TEST_P(DaemonSignals, LogsAndExitsCleanly) {
  const int signo = GetParam();
  TempDir home;
  auto env = xdgEnvironment(home.path());
  auto socket = XdgDirectories::underRoot(home.path()).socketPath();
  ChildProcess daemon(binDir() / "vireon-fbf", {}, env, home.path() / "out.log", home.path() / "err.log");

  ASSERT_TRUE(waitUntil([&] { return fs::exists(socket); }, std::chrono::seconds(10)))
      << readFile(home.path() / "err.log");
  struct stat st {};
  ASSERT_EQ(lstat(socket.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  // Wait until set-up has finished and the signal sources are installed.
  ASSERT_TRUE(waitUntil([&] { return readFile(home.path() / "err.log").find("setup") != std::string::npos; },
                        std::chrono::seconds(10)));

  daemon.signal(signo);
  auto status = daemon.waitFor(std::chrono::seconds(5));
  ASSERT_TRUE(status) << "daemon did not exit";
  EXPECT_EQ(*status, 0);
  std::string expected = signo == SIGTERM ? "fbf got SIGTERM" : "fbf got SIGINT";
  EXPECT_NE(readFile(home.path() / "err.log").find(expected), std::string::npos) << readFile(home.path() / "err.log");
}

INSTANTIATE_TEST_SUITE_P(TermAndInt, DaemonSignals, ::testing::Values(SIGTERM, SIGINT));

// Guards against: the daemon deleting a file that is not its socket.
TEST(DaemonStartUp, LeavesAFileThatIsNotASocketAlone) {
  TempDir home;
  auto env = xdgEnvironment(home.path());
  auto socket = XdgDirectories::underRoot(home.path()).socketPath();
  writeFile(socket, "not a socket");
  ChildProcess daemon(binDir() / "vireon-fbf", {}, env, home.path() / "out.log", home.path() / "err.log");
  ASSERT_TRUE(waitUntil([&] { return readFile(home.path() / "err.log").find("setup") != std::string::npos; },
                        std::chrono::seconds(10)))
      << readFile(home.path() / "err.log");
  EXPECT_EQ(readFile(socket), "not a socket");
  EXPECT_NE(readFile(home.path() / "err.log").find("is not a socket"), std::string::npos);
  daemon.signal(SIGTERM);
  EXPECT_EQ(daemon.waitFor(std::chrono::seconds(5)), 0);
}

}  // namespace
}  // namespace fbf::testing
