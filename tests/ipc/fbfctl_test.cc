// The command-line client run in-process against the in-process daemon, and
// its preference editing, which needs no daemon.

#include "fbfctl/fbfctl.h"
#include "ipc_fixture.h"

#include "corevireon.pb.h"

#include <sys/stat.h>

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
    int status = fbfctl::run(args, environment(out, err));
    return {status, out.str(), err.str()};
  }
  fbfctl::Environment environment(std::ostream& out, std::ostream& err) {
    fbfctl::Environment e;
    e.dirs = env.dirs;
    e.out = &out;
    e.err = &err;
    return e;
  }
};

// Guards against: a command sent as the wrong request, or answered with the wrong exit status or output.
TEST_F(TheCommandLine, EachCommandExitsWithItsStatusAndPrintsItsAnswer) {
  auto outside = (env.temp.path() / "session.1.AB.closed").string();
  struct Row {
    std::vector<std::string> args;
    int status;
    std::string out;  // what stdout starts with
    std::string err;  // what stderr starts with
  };
  const Row rows[] = {
      {{"flush"}, 0, "", ""},
      {{"flush", "--type", "UserReport"}, 0, "", ""},
      {{"flush-session", outside}, 1, "", "fbfctl: flush-session failed: refused: " + outside + " is outside"},
      {{"flush-session", (env.cacheDir() / "session.1.AB.closed").string()}, 0, "", ""},
      {{"update-whitelists", "if-stale"}, 0, "signature-2\n", ""},
      {{"update-whitelists", "sometimes"}, 2, "", ""},
      {{"status"}, 0, "", ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.args.front() + " " + row.args.back());
    auto run = cli(row.args);
    EXPECT_EQ(run.status, row.status) << run.err;
    EXPECT_EQ(run.out.rfind(row.out, 0), 0u) << run.out;
    EXPECT_EQ(run.err.rfind(row.err, 0), 0u) << run.err;
  }
  EXPECT_EQ(runner->calls(), (std::vector<std::string>{"flushAll", "flushCustomFeedbackType UserReport",
                                                       "flushSessionEagerly " + env.cacheDir().string() +
                                                           "/session.1.AB.closed"}));
  EXPECT_EQ(conditions(), std::vector<uint64_t>{2});
  EXPECT_NE(cli({"status"}).out.find("closed: 3 files, 4096 bytes, oldest 90 s"), std::string::npos);
  auto json = nlohmann::json::parse(cli({"status", "--json"}).out);
  EXPECT_EQ(json["sessions"][0]["files"], 3);
  EXPECT_EQ(json["pid"], getpid());

  service.reset();
  closeListener();
  fs::remove(socketPath());
  auto run = cli({"flush"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err.rfind("fbfctl: cannot connect to the daemon at " + socketPath().string() + ": ", 0), 0u);
}

// Guards against: tee missing an upload or printing it undecoded.
TEST_F(TheCommandLine, TeePrintsEachUploadAsOneDecodedJsonLine) {
  corevireon::CVClientSession session;
  session.set_agent("Wayfin/17.0");
  std::ostringstream out, err;
  std::promise<int> status;
  std::thread tee([&] { status.set_value(fbfctl::run({"tee", "uploads", "--count", "2"}, environment(out, err))); });
  ASSERT_TRUE(eventually([&] { return uploadListener() != nullptr; }));
  assembly->workloop().sync([&] {
    assembly->uploadListener()->willUploadData(session.SerializeAsString(), "FeedbackV2PB");
    assembly->uploadListener()->willUploadData(R"({"user_guid":"g"})", "FeedbackV2");
  });
  tee.join();
  EXPECT_EQ(status.get_future().get(), 0) << err.str();
  std::istringstream lines(out.str());
  std::string first, second;
  std::getline(lines, first);
  std::getline(lines, second);
  EXPECT_EQ(nlohmann::json::parse(first)["payload"]["agent"], "Wayfin/17.0");
  EXPECT_EQ(nlohmann::json::parse(second)["payload"]["user_guid"], "g");
}

// Guards against: preferences written with the wrong type or mode, read back wrongly, or bad values accepted.
TEST_F(TheCommandLine, DefaultsWritesReadsAndDeletesWithoutTheDaemon) {
  for (auto bad : {std::vector<std::string>{"vireond", "N", "-int", "12x"}, {"vireond", "B", "-bool", "maybe"},
                   {"../escape", "K", "v"}}) {
    bad.insert(bad.begin(), {"defaults", "write"});
    EXPECT_EQ(cli(bad).status, 2) << bad[2];
  }
  EXPECT_FALSE(fs::exists(env.dirs.preferencesDir() / "vireond.plist"));
  EXPECT_EQ(cli({"defaults", "write", "vireond", "FBFNoExit", "-bool", "true"}).status, 0);
  EXPECT_EQ(cli({"defaults", "write", "vireond", "FlushFrequencyInSeconds", "-int", "600"}).status, 0);
  EXPECT_EQ(cli({"defaults", "write", "vireond", "Name", "plain text"}).status, 0);
  EXPECT_TRUE(assembly->userDefaults().boolForKey("FBFNoExit"));
  EXPECT_EQ(assembly->userDefaults().integerForKey("FlushFrequencyInSeconds"), 600);
  EXPECT_EQ(cli({"defaults", "read", "vireond", "Name"}).out, "plain text\n");
  struct stat st {};
  ASSERT_EQ(stat((env.dirs.preferencesDir() / "vireond.plist").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_EQ(cli({"defaults", "delete", "vireond", "FBFNoExit"}).status, 0);
  EXPECT_EQ(cli({"defaults", "read", "vireond", "FBFNoExit"}).err,
            "fbfctl: no value for FBFNoExit in domain vireond\n");
}

}  // namespace
}  // namespace fbf::testing
