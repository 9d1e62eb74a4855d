// The command-line client run in-process against the in-process daemon, and
// its preference editing, which needs no daemon.

#include "fbfctl/fbfctl.h"
#include "fbfctl/payload_json.h"
#include "ipc_fixture.h"

#include "corevireon.pb.h"

#include <sys/stat.h>
#include <sys/wait.h>

#include <cstdio>
#include <cstdlib>
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

TEST_F(TheCommandLine, FlushReturnsZeroOnceTheFlushHasFinished) {
  auto run = cli({"flush"});
  EXPECT_EQ(run.status, 0) << run.err;
  run = cli({"flush", "--type", "UserReport"});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(runner->calls(),
            (std::vector<std::string>{"flushAll", "flushCustomFeedbackType UserReport"}));
}

TEST_F(TheCommandLine, FlushSessionReportsTheDaemonsRefusalInOneLine) {
  auto run = cli({"flush-session", (env.temp.path() / "session.1.AB.closed").string()});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(run.err.rfind("fbfctl: flush-session failed: refused: ", 0), 0u) << run.err;
  EXPECT_EQ(std::count(run.err.begin(), run.err.end(), '\n'), 1);

  run = cli({"flush-session", (env.cacheDir() / "session.1.AB.closed").string()});
  EXPECT_EQ(run.status, 0) << run.err;
}

TEST_F(TheCommandLine, UpdateWhitelistsPrintsTheStoredSignature) {
  auto run = cli({"update-whitelists", "if-stale"});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_EQ(run.out, "signature-2\n");
  run = cli({"update-whitelists", "sometimes"});
  EXPECT_EQ(run.status, 2);
  assembly->workloop().sync([&] { EXPECT_EQ(controller->conditions, std::vector<uint64_t>{2}); });
}

TEST_F(TheCommandLine, StatusIsReadableAndOneJsonObjectOnRequest) {
  auto run = cli({"status"});
  EXPECT_EQ(run.status, 0) << run.err;
  EXPECT_NE(run.out.find("closed: 3 files, 4096 bytes, oldest 90 s"), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("UserReport: 1 file, 10 bytes"), std::string::npos) << run.out;

  run = cli({"status", "--json"});
  EXPECT_EQ(run.status, 0) << run.err;
  auto json = nlohmann::json::parse(run.out);
  EXPECT_EQ(json["sessions"][0]["name"], "closed");
  EXPECT_EQ(json["sessions"][0]["files"], 3);
  EXPECT_EQ(json["pid"], getpid());
  EXPECT_EQ(json["uploadsListener"], false);
}

TEST_F(TheCommandLine, TeePrintsEachUploadAsOneDecodedJsonLine) {
  corevireon::CVClientSession session;
  session.set_agent("Wayfin/17.0");
  std::ostringstream out, err;
  fbfctl::Environment e;
  e.dirs = env.dirs;
  e.out = &out;
  e.err = &err;
  std::promise<int> status;
  std::thread tee([&] { status.set_value(fbfctl::run({"tee", "uploads", "--count", "2"}, e)); });

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
  auto a = nlohmann::json::parse(first);
  EXPECT_EQ(a["format"], "FeedbackV2PB");
  EXPECT_EQ(a["payload"]["agent"], "Wayfin/17.0");
  auto b = nlohmann::json::parse(second);
  EXPECT_EQ(b["payload"]["user_guid"], "g");
  EXPECT_NE(err.str().find("listening for uploads"), std::string::npos);
}

TEST_F(TheCommandLine, FailsWithOneLineWhenNoDaemonListens) {
  service.reset();
  std::promise<void> closed;
  asio::post(io, [&] {
    acceptor->close();
    closed.set_value();
  });
  closed.get_future().wait();
  fs::remove(socketPath());

  auto run = cli({"flush"});
  EXPECT_EQ(run.status, 1);
  EXPECT_EQ(
      run.err.rfind("fbfctl: cannot connect to the daemon at " + socketPath().string() + ": ", 0),
      0u)
      << run.err;
}

TEST_F(TheCommandLine, DefaultsWritesReadsAndDeletesWithoutTheDaemon) {
  EXPECT_EQ(cli({"defaults", "write", "vireond", "FBFNoExit", "-bool", "true"}).status, 0);
  EXPECT_EQ(cli({"defaults", "write", "vireond", "FlushFrequencyInSeconds", "-int", "600"}).status,
            0);
  EXPECT_EQ(cli({"defaults", "write", "vireond", "Name", "plain text"}).status, 0);

  EXPECT_TRUE(assembly->userDefaults().boolForKey("FBFNoExit"));
  EXPECT_EQ(assembly->userDefaults().integerForKey("FlushFrequencyInSeconds"), 600);
  EXPECT_EQ(cli({"defaults", "read", "vireond", "Name"}).out, "plain text\n");
  EXPECT_EQ(cli({"defaults", "read", "vireond", "FBFNoExit"}).out, "true\n");
  auto whole = nlohmann::json::parse(cli({"defaults", "read", "vireond"}).out);
  EXPECT_EQ(whole["FlushFrequencyInSeconds"], 600);

  auto file = env.dirs.preferencesDir() / "vireond.plist";
  struct stat st {};
  ASSERT_EQ(stat(file.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);

  EXPECT_EQ(cli({"defaults", "delete", "vireond", "FBFNoExit"}).status, 0);
  auto missing = cli({"defaults", "read", "vireond", "FBFNoExit"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(missing.err, "fbfctl: no value for FBFNoExit in domain vireond\n");
  EXPECT_EQ(cli({"defaults", "delete", "vireond"}).status, 0);
  EXPECT_EQ(nlohmann::json::parse(cli({"defaults", "read", "vireond"}).out),
            nlohmann::json::object());
}

TEST_F(TheCommandLine, DefaultsRejectsBadValuesAndDomainsThatAreNotNames) {
  EXPECT_EQ(cli({"defaults", "write", "vireond", "N", "-int", "12x"}).status, 2);
  EXPECT_EQ(cli({"defaults", "write", "vireond", "B", "-bool", "maybe"}).status, 2);
  EXPECT_EQ(cli({"defaults", "write", "../escape", "K", "v"}).status, 2);
  EXPECT_FALSE(fs::exists(env.dirs.preferencesDir() / "vireond.plist"));
}

// ---------------------------------------------------------------------------

// Runs a shell command line; its exit status and standard output.
std::pair<int, std::string> shell(const std::string& command) {
  std::string out;
  FILE* pipe = popen(command.c_str(), "r");
  if (!pipe) return {-1, out};
  char buffer[512];
  size_t n;
  while ((n = fread(buffer, 1, sizeof buffer, pipe)) > 0) out.append(buffer, n);
  int status = pclose(pipe);
  return {WIFEXITED(status) ? WEXITSTATUS(status) : -1, out};
}

TEST(TheInstalledProgram, FindsPreferencesAndTheSocketThroughTheXdgVariables) {
  const char* bin = std::getenv("FBF_BIN_DIR");
  if (!bin) GTEST_SKIP() << "FBF_BIN_DIR is set when run through ctest";
  TempDir home;
  std::string run = "XDG_CONFIG_HOME=" + (home.path() / "config").string() +
                    " XDG_RUNTIME_DIR=" + (home.path() / "run").string() + " " + bin + "/fbfctl ";

  EXPECT_EQ(shell(run + "defaults write vireond FlushFrequencyInSeconds -int 5").first, 0);
  EXPECT_TRUE(fs::exists(home.path() / "config" / "preferences" / "vireond.plist"));
  EXPECT_EQ(shell(run + "defaults read vireond FlushFrequencyInSeconds"),
            std::make_pair(0, std::string("5\n")));

  auto [status, out] = shell(run + "flush 2>&1");
  EXPECT_EQ(status, 1);
  auto expected = "fbfctl: cannot connect to the daemon at " +
                  (home.path() / "run" / "vireon-fbf.sock").string();
  EXPECT_EQ(out.rfind(expected, 0), 0u) << out;
}

TEST(TeeOutput, KeepsUndecodablePayloadsAsBase64WithTheReason) {
  auto garbage = fbfctl::describeUpload(std::string("\xff\xff\xff", 3), "FeedbackV2PB");
  EXPECT_EQ(garbage["error"], "does not decode as a session");
  EXPECT_EQ(garbage["payloadBase64"], "////");
  EXPECT_FALSE(garbage.contains("payload"));

  auto opaque = fbfctl::describeUpload("not json", "Crowdsourcing");
  EXPECT_FALSE(opaque.contains("error"));
  EXPECT_EQ(opaque["payloadBase64"], "bm90IGpzb24=");
  EXPECT_EQ(opaque["bytes"], 8);
}

TEST(TeeOutput, DecodesUsageFeedbackAndCohortEnvelopes) {
  corevireon::CVCohortsFeedback feedback;
  feedback.mutable_usageenvelope()->set_configuredlookbacktimeindays(28);
  auto usage = fbfctl::describeUpload(feedback.SerializeAsString(), "Usage");
  EXPECT_EQ(usage["payload"]["usageEnvelope"]["configuredLookbackTimeInDays"], 28);

  corevireon::CVUsageEnvelope envelope;
  envelope.mutable_usagesincelookback()->set_activedaysincollectionperiod(5);
  auto cohorts = fbfctl::describeCohortFeedback(envelope.SerializeAsString());
  EXPECT_EQ(cohorts["format"], "cohorts");
  EXPECT_EQ(cohorts["payload"]["usageSinceLookback"]["activeDaysInCollectionPeriod"], 5);
}

TEST(TeeOutput, Base64MatchesTheStandardAlphabetAndPadding) {
  EXPECT_EQ(fbfctl::base64(""), "");
  EXPECT_EQ(fbfctl::base64("f"), "Zg==");
  EXPECT_EQ(fbfctl::base64("fo"), "Zm8=");
  EXPECT_EQ(fbfctl::base64("foobar"), "Zm9vYmFy");
}

}  // namespace
}  // namespace fbf::testing
