#include "support/process.h"
#include "support/test_support.h"

#include <signal.h>
#include <sys/stat.h>

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

// The real daemon in a throw-away home, started once set-up has finished
// and the signal sources are installed.
struct Daemon {
  // `socketContent`, when given, is a file left where the socket goes.
  explicit Daemon(const std::string& socketContent = "")
      : placed(socketContent.empty() || (writeFile(socket, socketContent), true)) {
    EXPECT_TRUE(waitUntil([&] { return fs::exists(socket) && log().find("setup") != std::string::npos; }, 10s))
        << log();
  }
  std::string log() const { return readFile(home.path() / "err.log"); }
  TempDir home;
  fs::path socket = XdgDirectories::underRoot(home.path()).socketPath();
  bool placed;
  ChildProcess process{binDir() / "vireon-fbf", {}, xdgEnvironment(home.path()), home.path() / "out.log",
                       home.path() / "err.log"};
};

// Guards against: the daemon ending on SIGTERM or SIGINT without its log line and a clean exit, or serving a socket others can use.
// (SIGTERM's clean exit is checked by every end-to-end test that stops its daemon.)
TEST(DaemonSignals, LogAndExitCleanlyFromAnOwnerOnlySocket) {
  Daemon daemon;
  struct stat st {};
  ASSERT_EQ(lstat(daemon.socket.c_str(), &st), 0);
  EXPECT_TRUE(S_ISSOCK(st.st_mode));
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  daemon.process.signal(SIGINT);
  EXPECT_EQ(daemon.process.waitFor(5s), 0);
  EXPECT_NE(daemon.log().find("fbf got SIGINT"), std::string::npos) << daemon.log();
}

// Guards against: the daemon deleting a file that is not its socket.
TEST(DaemonStartUp, LeavesAFileThatIsNotASocketAlone) {
  Daemon daemon("not a socket");
  EXPECT_EQ(readFile(daemon.socket), "not a socket");
  EXPECT_NE(daemon.log().find("is not a socket"), std::string::npos);
  daemon.process.signal(SIGTERM);
  EXPECT_EQ(daemon.process.waitFor(5s), 0);
}

}  // namespace
}  // namespace fbf::testing
