// The command-line client run in-process against the in-process daemon, and
// its preference editing, which needs no daemon. Its other commands run as
// the real program in the end-to-end tests.

#include "fbfctl/fbfctl.h"
#include "ipc_fixture.h"

#include <sstream>

namespace fbf::testing {
namespace {

struct CommandRun {
  int status;
  std::string out;
  std::string err;
};

class TheCommandLine : public IpcFixture {
 protected:
  CommandRun cli(std::vector<std::string> args) {
    std::ostringstream out, err;
    fbfctl::Environment e;
    e.dirs = env.dirs;
    e.out = &out;
    e.err = &err;
    int status = fbfctl::run(args, e);
    return {status, out.str(), err.str()};
  }
};

// Guards against: a custom type flush sent as another request, or a missing daemon reported without its socket.
TEST_F(TheCommandLine, FlushesOneCustomTypeAndNamesTheSocketWhenNoDaemonListens) {
  auto run = cli({"flush", "--type", "UserReport"});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(runner->calls(), std::vector<std::string>{"flushCustomFeedbackType UserReport"});

  service.reset();
  closeListener();
  fs::remove(socketPath());
  run = cli({"flush"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err.rfind("fbfctl: cannot connect to the daemon at " + socketPath().string() + ": ", 0), 0u);
}

// Guards against: preferences written with the wrong mode, read back wrongly, or bad values or domains accepted.
TEST_F(TheCommandLine, DefaultsWritesReadsAndDeletesWithoutTheDaemon) {
  for (auto bad : {std::vector<std::string>{"vireond", "N", "-int", "12x"}, {"../escape", "K", "v"}}) {
    bad.insert(bad.begin(), {"defaults", "write"});
    EXPECT_EQ(cli(bad).status, 2) << bad[2];
  }
  EXPECT_FALSE(fs::exists(env.dirs.preferencesDir() / "vireond.plist"));
  EXPECT_EQ(cli({"defaults", "write", "vireond", "Name", "plain text"}).status, 0);
  EXPECT_EQ(cli({"defaults", "read", "vireond", "Name"}).out, "plain text\n");
  EXPECT_EQ(env.fileManager->attributes(env.dirs.preferencesDir() / "vireond.plist").value().mode,
            0600u);
  EXPECT_EQ(cli({"defaults", "delete", "vireond", "Name"}).status, 0);
  EXPECT_EQ(cli({"defaults", "read", "vireond", "Name"}).err, "fbfctl: no value for Name in domain vireond\n");
}

}  // namespace
}  // namespace fbf::testing
