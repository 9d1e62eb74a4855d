#include "whitelist/installed_app_controller.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"
#include "whitelist/whitelist_fixtures.h"

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

using namespace std::chrono_literals;

constexpr uint64_t kNow = 0;
constexpr uint64_t kSoon = 1;
constexpr uint64_t kIfStale = 2;

class RecordingQuerier final : public VexaAppQuerierProtocol {
 public:
  std::vector<std::string> findEnabledVexaApps(const std::vector<std::string>&, const std::set<std::string>&) override {
    ++calls;
    return {"seed", "org.vireon.Notes"};
  }
  size_t calls = 0;
};

class RecordingPoster final : public NotificationPoster {
 public:
  void post(std::string_view name) override { posted.emplace_back(name); }
  std::vector<std::string> posted;
};

// A controller over the test environment's assembly, with its own hand-run
// low-priority queue, three installed applications and a whitelist resource
// in the temporary XDG data home. What it stores is checked through the
// daemon (e2e_whitelist); here: when it runs and what it holds meanwhile.
class WhitelistUpdates : public ::testing::Test {
 protected:
  WhitelistUpdates() {
    registry->apps = {installed("org.example.Mail"), installed("org.example.Maps"), installed("vendor-tool")};
    InstalledAppControllerDependencies deps;
    deps.lowPriorityQueue = queue;
    deps.transactions = env.transactions.get();
    deps.applications = registry;
    deps.resources = std::make_shared<XdgDataResourceLocator>(env.dirs);
    deps.vexaAppQuerier = querier;
    deps.notifications = poster;
    controller = std::make_unique<InstalledAppController>(env.assembly(), std::move(deps));
    writeFile(env.dirs.dataHome / "vireond" / "app-whitelist.json",
              whitelistDocument({{"org.example.Mail", entry(0)}}));
  }

  fs::path assistantList() const { return env.cacheDir() / "assistant-apps.json"; }
  int openTransactions() { return env.transactions->openCount(); }
  // Makes a request and lets the queue take it in (arming the timer).
  void request(uint64_t condition, std::function<void()> completion) {
    controller->updateWhitelists(condition, std::move(completion));
    queue->drain();
  }
  // Runs one request to its end; true when its completion ran.
  bool updateNow(uint64_t condition = kNow) {
    bool done = false;
    request(condition, [&done] { done = true; });
    queue->advance(5ms);
    return done;
  }

  TestEnvironment env;
  LogCapture logs;
  std::shared_ptr<ManualQueue> queue = std::make_shared<ManualQueue>("vireon-fbf.lowPriority");
  std::shared_ptr<FixedRegistry> registry = std::make_shared<FixedRegistry>();
  std::shared_ptr<RecordingQuerier> querier = std::make_shared<RecordingQuerier>();
  std::shared_ptr<RecordingPoster> poster = std::make_shared<RecordingPoster>();
  std::unique_ptr<InstalledAppController> controller;
};

// Guards against: a request served after the wrong delay (5 ms; 60 s for soon, or the 0 to 86400 s preference).
TEST_F(WhitelistUpdates, EachConditionWaitsItsDelay) {
  struct Row {
    const char* name;
    uint64_t condition;
    std::optional<PropertyList> preference;
    std::chrono::milliseconds delay;
    const char* logLine;
  };
  const Row rows[] = {
      {"now", kNow, std::nullopt, 5ms, "update whitelists now"},
      {"unknown", 7, std::nullopt, 5ms, "update whitelists for reasons unknown"},
      {"now ignores the preference", kNow, 2, 5ms, "update whitelists now"},
      {"soon", kSoon, std::nullopt, 60s, "update whitelists soon"},
      {"soon, preference 0", kSoon, 0, 0ms, "update whitelists soon"},
      {"soon, preference at the limit", kSoon, 86400, 86400s, "update whitelists soon"},
      {"soon, preference past the limit", kSoon, 86401, 60s, "update whitelists soon"},
      {"soon, negative preference", kSoon, -1, 60s, "update whitelists soon"},
      {"soon, preference not a number", kSoon, "2", 60s, "update whitelists soon"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    LogCapture rowLogs;
    fs::remove(assistantList());
    if (row.preference) {
      env.defaults().setObject(FBFStrings::LinuxDefaults::WhitelistSoonDelaySeconds, *row.preference);
    } else {
      env.defaults().removeObject(FBFStrings::LinuxDefaults::WhitelistSoonDelaySeconds);
    }
    bool done = false;
    request(row.condition, [&] { done = true; });
    if (row.delay > 0ms) {
      queue->advance(row.delay - 1ms);
      EXPECT_FALSE(done);
    }
    queue->advance(row.delay > 0ms ? 1ms : 0ms);
    EXPECT_TRUE(done);
    EXPECT_TRUE(rowLogs.contains(row.logLine));
  }
}

// Guards against: requests not coalesced into one generation, completions lost or reordered, the timer not re-armed.
TEST_F(WhitelistUpdates, TenSoonRequestsShareOneGenerationAndCompleteInOrder) {
  std::vector<int> completed;
  for (int i = 0; i < 10; ++i) {
    if (i > 0) queue->advance(5s);
    request(kSoon, [&completed, i] { completed.push_back(i); });
  }
  EXPECT_EQ(openTransactions(), 1);
  // Alone, the first request (at 0 s) would have fired at 60 s; this is 104 s.
  queue->advance(59s);
  EXPECT_TRUE(completed.empty());
  queue->advance(1s);
  EXPECT_EQ(completed, (std::vector<int>{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));
  EXPECT_EQ(querier->calls, 1u);
  EXPECT_EQ(poster->posted.size(), 1u);
  EXPECT_EQ(logs.count("updated signature user default"), 1u);
  EXPECT_EQ(openTransactions(), 0);
  EXPECT_FALSE(controller->isGeneratingWhitelist());

  // A "now" request shortens the armed "soon" timer.
  request(kSoon, [&] { completed.push_back(10); });
  queue->advance(30s);
  request(kNow, [&] { completed.push_back(11); });
  queue->advance(5ms);
  EXPECT_EQ(completed.size(), 12u);
  EXPECT_EQ(querier->calls, 2u);
}

// Guards against: the process allowed to exit between a request and the generation serving it.
TEST_F(WhitelistUpdates, ATransactionIsHeldFromEachRequestToItsGeneration) {
  int openDuringCompletion = -1;
  bool second = false;
  controller->updateWhitelists(kNow, [&] {
    openDuringCompletion = openTransactions();
    controller->updateWhitelists(kNow, [&] { second = true; });
  });
  EXPECT_EQ(openTransactions(), 1);  // before the queue has taken the request in
  queue->drain();
  EXPECT_EQ(openTransactions(), 1);
  queue->advance(5ms);
  EXPECT_EQ(openDuringCompletion, 1);
  EXPECT_FALSE(second);
  EXPECT_EQ(openTransactions(), 1);
  queue->advance(5ms);
  EXPECT_TRUE(second);
  EXPECT_EQ(openTransactions(), 0);
}

// Guards against: queued work running on a destroyed controller.
TEST_F(WhitelistUpdates, DestroyedControllerRunsNothingMore) {
  bool done = false;
  controller->updateWhitelists(kNow, [&] { done = true; });
  controller.reset();
  queue->advance(1min);
  EXPECT_FALSE(done);
  EXPECT_EQ(querier->calls, 0u);
  EXPECT_EQ(openTransactions(), 0);
}

// Guards against: the assistant list written world-readable, unsorted or unannounced, or a failed write stopping work.
TEST_F(WhitelistUpdates, AssistantListIsWrittenOwnerOnlyAndAnnounced) {
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(readFile(assistantList()), R"(["org.vireon.Notes","seed"])");
  EXPECT_EQ(env.fileManager->attributes(assistantList()).value().mode, 0600u);
  EXPECT_EQ(poster->posted, (std::vector<std::string>{"vireon-fbf.skapp_data_changed"}));
  EXPECT_TRUE(logs.contains("updated whitelist file"));

  fs::remove(assistantList());
  fs::create_directories(assistantList() / "in-the-way");
  ASSERT_TRUE(updateNow());
  EXPECT_TRUE(logs.contains("could not write whitelist file " + assistantList().string()));
  EXPECT_EQ(poster->posted.size(), 1u);
}

// Guards against: "if stale" redoing a list under 48 h old, or not refreshing or creating (0600) the list at once.
TEST_F(WhitelistUpdates, IfStaleWorksOnlyOnAListOlderThan48Hours) {
  bool done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_FALSE(done);
  EXPECT_EQ(readFile(assistantList()), "");  // created empty
  EXPECT_EQ(env.fileManager->attributes(assistantList()).value().mode, 0600u);
  queue->drain();
  queue->advance(5ms);
  EXPECT_TRUE(done);
  EXPECT_TRUE(logs.contains("update whitelists if stale"));
  ASSERT_EQ(querier->calls, 1u);

  env.clock->advance(47h);
  done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_TRUE(done);  // at once, without waiting for the queue
  EXPECT_TRUE(logs.contains("whitelist already up-to-date"));
  EXPECT_EQ(openTransactions(), 0);

  env.clock->advance(2h);
  request(kIfStale, nullptr);
  EXPECT_EQ(env.fileManager->attributes(assistantList())->modificationDate, env.clock->now());
  // A second check now finds it fresh, although the generation has not run yet.
  done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_TRUE(done);
  queue->advance(5ms);
  EXPECT_EQ(querier->calls, 2u);
}

// Guards against: a link in place of the list being followed or kept.
TEST_F(WhitelistUpdates, IfStaleWithALinkInPlaceOfTheListGoesOn) {
  fs::create_symlink("/etc/passwd", assistantList());
  EXPECT_TRUE(updateNow(kIfStale));
  EXPECT_TRUE(logs.contains("could not get modify time"));
  EXPECT_FALSE(fs::is_symlink(assistantList()));
}

}  // namespace
}  // namespace fbf::testing
