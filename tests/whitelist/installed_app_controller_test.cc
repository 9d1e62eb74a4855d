#include "whitelist/installed_app_controller.h"

#include "assembly/fbf_strings.h"
#include "support/test_support.h"
#include "whitelist/signature_decoder.h"

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <future>

namespace fbf {
namespace {

using namespace std::chrono_literals;

constexpr uint64_t kNow = 0;
constexpr uint64_t kSoon = 1;
constexpr uint64_t kIfStale = 2;
constexpr std::string_view kSignatureKey = FBFStrings::kVIRAppWhitelistSignatureKey;

class FixedRegistry final : public ApplicationRegistry {
 public:
  std::vector<InstalledApplication> installedApplications() const override { return apps; }
  std::vector<InstalledApplication> apps;
};

class RecordingQuerier final : public VexaAppQuerierProtocol {
 public:
  std::vector<std::string> findEnabledVexaApps(
      const std::vector<std::string>& apps,
      const std::set<std::string>& manuallyDisabledApps) override {
    calls.push_back({apps, manuallyDisabledApps});
    return answer;
  }
  std::vector<std::pair<std::vector<std::string>, std::set<std::string>>> calls;
  std::vector<std::string> answer = {"seed", "org.vireon.Notes"};
};

class RecordingPoster final : public NotificationPoster {
 public:
  void post(std::string_view name) override { posted.emplace_back(name); }
  std::vector<std::string> posted;
};

std::string whitelistDocument(const nlohmann::json& apps, std::string version = "0a1F") {
  nlohmann::json inner = {{"version", version}, {"apps", apps}};
  return nlohmann::json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "bitmap"}}
      .dump();
}

// A controller over the test environment's assembly, with its own hand-run
// low-priority queue, a fixed set of installed applications and a whitelist
// resource in the temporary XDG data home.
class WhitelistUpdates : public ::testing::Test {
 protected:
  WhitelistUpdates() {
    registry->apps = {{"org.example.Mail", std::string("1"), false},
                      {"org.example.Maps", std::string("1"), false},
                      {"vendor-tool", std::string("1"), false}};
    InstalledAppControllerDependencies deps;
    deps.lowPriorityQueue = queue;
    deps.transactions = env.transactions.get();
    deps.applications = registry;
    deps.resources = std::make_shared<XdgDataResourceLocator>(env.dirs);
    deps.vexaAppQuerier = querier;
    deps.notifications = poster;
    controller = std::make_unique<InstalledAppController>(env.assembly(), std::move(deps));
  }

  fs::path resourcePath() const { return env.dirs.dataHome / "vireond" / "app-whitelist.json"; }
  fs::path assistantList() const { return env.cacheDir() / "assistant-apps.json"; }
  void writeResource(const std::string& text) { testing::writeFile(resourcePath(), text); }
  void writeStandardResource() {
    writeResource(whitelistDocument({{"org.example.Mail", {{{"encoding_id", 0}}}},
                                     {"vendor-tool", {{{"encoding_id", 9}}}},
                                     {"org.example.Other", {{{"encoding_id", 4}}}}}));
  }
  std::optional<std::string> storedSignature() {
    return env.defaults().stringForKey(kSignatureKey);
  }
  std::optional<std::vector<uint8_t>> storedBitmap() {
    auto signature = storedSignature();
    if (!signature) return std::nullopt;
    std::string why;
    auto decoded = testing::decodeSignature(*signature, &why);
    EXPECT_TRUE(decoded) << why;
    if (!decoded) return std::nullopt;
    return decoded->bitmap;
  }
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

  testing::TestEnvironment env;
  testing::LogCapture logs;
  std::shared_ptr<testing::ManualQueue> queue =
      std::make_shared<testing::ManualQueue>("vireon-fbf.lowPriority");
  std::shared_ptr<FixedRegistry> registry = std::make_shared<FixedRegistry>();
  std::shared_ptr<RecordingQuerier> querier = std::make_shared<RecordingQuerier>();
  std::shared_ptr<RecordingPoster> poster = std::make_shared<RecordingPoster>();
  std::unique_ptr<InstalledAppController> controller;
};

TEST_F(WhitelistUpdates, TenSoonRequestsShareOneGenerationAndCompleteInOrder) {
  writeStandardResource();
  std::vector<int> completed;
  for (int i = 0; i < 10; ++i) {
    if (i > 0) queue->advance(5s);
    request(kSoon, [&completed, i] { completed.push_back(i); });
  }
  EXPECT_TRUE(completed.empty());
  EXPECT_EQ(env.transactions->openCount(), 1);

  // Alone, the first request (at 0 s) would have fired at 60 s; this is 104 s.
  queue->advance(59s);
  EXPECT_TRUE(completed.empty());
  queue->advance(1s);
  EXPECT_EQ(completed, (std::vector<int>{0, 1, 2, 3, 4, 5, 6, 7, 8, 9}));
  EXPECT_EQ(querier->calls.size(), 1u);
  EXPECT_EQ(poster->posted.size(), 1u);
  EXPECT_EQ(logs.count("update whitelists soon"), 10u);
  EXPECT_EQ(logs.count("updated signature user default"), 1u);
  EXPECT_EQ(env.transactions->openCount(), 0);
  EXPECT_FALSE(controller->isGeneratingWhitelist());
}

TEST_F(WhitelistUpdates, TransactionIsHeldFromRequestToCompletion) {
  writeStandardResource();
  int openDuringCompletion = -1;
  controller->updateWhitelists(kNow, [&] { openDuringCompletion = env.transactions->openCount(); });
  EXPECT_EQ(env.transactions->openCount(), 1);  // before the queue has taken the request in
  queue->drain();
  EXPECT_EQ(env.transactions->openCount(), 1);
  queue->advance(5ms);
  EXPECT_EQ(openDuringCompletion, 1);
  EXPECT_EQ(env.transactions->openCount(), 0);
}

TEST_F(WhitelistUpdates, RequestArrivingDuringAGenerationKeepsItsOwnTransaction) {
  writeStandardResource();
  bool second = false;
  request(kNow, [&] {
    // A client asks again while the first generation is finishing.
    controller->updateWhitelists(kNow, [&] { second = true; });
  });
  queue->advance(5ms);
  EXPECT_FALSE(second);
  EXPECT_EQ(env.transactions->openCount(), 1);
  queue->advance(5ms);
  EXPECT_TRUE(second);
  EXPECT_EQ(env.transactions->openCount(), 0);
}

TEST_F(WhitelistUpdates, NowAndUnknownConditionsRunAfterFiveMilliseconds) {
  writeStandardResource();
  bool done = false;
  request(kNow, [&] { done = true; });
  queue->advance(4ms);
  EXPECT_FALSE(done);
  queue->advance(1ms);
  EXPECT_TRUE(done);

  EXPECT_TRUE(updateNow(7));
  EXPECT_TRUE(logs.contains("update whitelists now"));
  EXPECT_TRUE(logs.contains("update whitelists for reasons unknown"));
}

TEST_F(WhitelistUpdates, SoonDelayComesFromTheTestPreference) {
  writeStandardResource();
  env.defaults().setObject(FBFStrings::LinuxDefaults::WhitelistSoonDelaySeconds, 2);
  bool done = false;
  request(kSoon, [&] { done = true; });
  queue->advance(1999ms);
  EXPECT_FALSE(done);
  queue->advance(1ms);
  EXPECT_TRUE(done);
}

TEST_F(WhitelistUpdates, EveryRequestReArmsTheOneTimer) {
  writeStandardResource();
  std::vector<int> completed;
  request(kSoon, [&] { completed.push_back(1); });
  queue->advance(30s);
  request(kNow, [&] { completed.push_back(2); });
  queue->advance(5ms);
  EXPECT_EQ(completed, (std::vector<int>{1, 2}));
  EXPECT_EQ(querier->calls.size(), 1u);
}

TEST_F(WhitelistUpdates, StoresTheSignatureOfInstalledWhitelistedApps) {
  writeStandardResource();
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x80, 0x40}));
  EXPECT_TRUE(logs.contains("signature: " + storedSignature().value_or("?")));
}

TEST_F(WhitelistUpdates, AppsDisabledForSearchAreLeftOutAndPassedOn) {
  writeStandardResource();
  auto searchUI =
      env.preferences->defaultsForDomain(std::string(FBFStrings::LinuxDefaults::SearchUIDomain));
  searchUI->setObject(FBFStrings::LinuxDefaults::DisabledApplications,
                      nlohmann::json::array({"vendor-tool"}));
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x80}));
  ASSERT_EQ(querier->calls.size(), 1u);
  EXPECT_EQ(querier->calls[0].first, (std::vector<std::string>{std::string(
                                         InstalledAppController::VexaNonAppSuggestionBundleId)}));
  EXPECT_EQ(querier->calls[0].second, (std::set<std::string>{"vendor-tool"}));
}

TEST_F(WhitelistUpdates, AppWhoseLastEntryHasNoIdIsLeftOutAndOthersStillCount) {
  writeResource(
      whitelistDocument({{"org.example.Mail", {{{"encoding_id", 3}}, {{"note", "retired"}}}},
                         {"org.example.Maps", {{{"encoding_id", 1}}}}}));
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x40}));
}

TEST_F(WhitelistUpdates, NoWhitelistedApplicationRemovesTheKey) {
  env.defaults().setObject(kSignatureKey, "old");
  writeResource(whitelistDocument({{"org.example.NotInstalled", {{{"encoding_id", 0}}}}}));
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_TRUE(logs.contains("updated signature user default"));
}

TEST_F(WhitelistUpdates, MissingResourceRemovesTheKey) {
  env.defaults().setObject(kSignatureKey, "old");
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_TRUE(logs.contains("no file handle for vireond/app-whitelist.json: "));
  EXPECT_TRUE(logs.contains("Could not obtain file handle for installed app whitelist"));
  // The assistant list is still written.
  EXPECT_EQ(querier->calls.size(), 1u);
}

TEST_F(WhitelistUpdates, ResourceThatIsNotARegularFileRemovesTheKey) {
  env.defaults().setObject(kSignatureKey, "old");
  fs::create_directories(resourcePath());
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_TRUE(logs.contains("not a regular file"));
  EXPECT_TRUE(logs.contains("Could not obtain file handle for installed app whitelist"));
}

TEST_F(WhitelistUpdates, EmptyResourceCannotBeMapped) {
  env.defaults().setObject(kSignatureKey, "old");
  writeResource("");
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedSignature(), std::nullopt);
  EXPECT_TRUE(logs.contains("mappedData is nil"));
}

TEST_F(WhitelistUpdates, MalformedResourcesRemoveTheKey) {
  std::string good = whitelistDocument({{"org.example.Mail", {{{"encoding_id", 0}}}}});
  nlohmann::json inner = {{"version", "1"},
                          {"apps", {{"org.example.Mail", {{{"encoding_id", 0}}}}}}};
  std::vector<std::string> documents = {
      nlohmann::json{{"apps", inner.dump()}, {"compression", "zlib"}, {"encoding", "bitmap"}}
          .dump(),
      nlohmann::json{{"apps", inner.dump()}, {"compression", "RLE"}, {"encoding", "list"}}.dump(),
      good.substr(0, good.size() - 7),
  };
  for (const auto& doc : documents) {
    env.defaults().setObject(kSignatureKey, "old");
    writeResource(doc);
    size_t before = logs.count("installed app whitelist vireond/app-whitelist.json is malformed");
    ASSERT_TRUE(updateNow()) << doc;
    EXPECT_EQ(storedSignature(), std::nullopt) << doc;
    EXPECT_EQ(logs.count("installed app whitelist vireond/app-whitelist.json is malformed"),
              before + 1)
        << doc;
  }
  // The controller still works afterwards.
  writeResource(good);
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x80}));
}

TEST_F(WhitelistUpdates, ResourceFromTheFirstDataDirectoryThatHasOne) {
  auto system = env.dirs.dataDirs.at(0) / "vireond" / "app-whitelist.json";
  testing::writeFile(system, whitelistDocument({{"org.example.Maps", {{{"encoding_id", 1}}}}}));
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x40}));
  writeStandardResource();  // the data home comes first
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(storedBitmap(), (std::vector<uint8_t>{0x80, 0x40}));
}

TEST_F(WhitelistUpdates, AssistantListIsWrittenOwnerOnlyAndAnnounced) {
  writeStandardResource();
  ASSERT_TRUE(updateNow());
  EXPECT_EQ(nlohmann::json::parse(testing::readFile(assistantList())),
            nlohmann::json::array({"org.vireon.Notes", "seed"}));
  struct stat st {};
  ASSERT_EQ(stat(assistantList().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_EQ(poster->posted, (std::vector<std::string>{"vireon-fbf.skapp_data_changed"}));
  EXPECT_TRUE(logs.contains("updated whitelist file"));
}

TEST_F(WhitelistUpdates, UnwritableAssistantListIsLoggedAndCompletionsStillRun) {
  writeStandardResource();
  fs::create_directories(assistantList() / "in-the-way");
  ASSERT_TRUE(updateNow());
  EXPECT_TRUE(logs.contains("could not write whitelist file " + assistantList().string()));
  EXPECT_TRUE(poster->posted.empty());
  EXPECT_TRUE(storedSignature().has_value());
}

TEST_F(WhitelistUpdates, TwoIfStaleRequestsWithin48Hours) {
  writeStandardResource();
  ASSERT_TRUE(updateNow(kIfStale));
  EXPECT_EQ(querier->calls.size(), 1u);

  env.clock->advance(47h);
  bool done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_TRUE(done);  // at once, without waiting for the queue
  EXPECT_TRUE(logs.contains("whitelist already up-to-date"));
  queue->advance(1min);
  EXPECT_EQ(querier->calls.size(), 1u);
  EXPECT_EQ(env.transactions->openCount(), 0);
}

TEST_F(WhitelistUpdates, IfStaleRefreshesTheTimeStampBeforeWorking) {
  writeStandardResource();
  testing::writeFile(assistantList(), "[]");
  // Written "now"; after 49 hours it is stale.
  env.clock->advance(49h);
  SystemTime refreshed = env.clock->now();
  request(kIfStale, nullptr);
  auto attributes = env.fileManager->attributes(assistantList());
  ASSERT_TRUE(attributes);
  EXPECT_EQ(attributes->modificationDate, refreshed);
  EXPECT_FALSE(logs.contains("whitelist already up-to-date"));
  // A second check now finds it fresh, although the generation has not run yet.
  bool done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_TRUE(done);
  queue->advance(5ms);
  EXPECT_EQ(querier->calls.size(), 1u);
}

TEST_F(WhitelistUpdates, IfStaleCreatesAMissingListEmpty) {
  writeStandardResource();
  bool done = false;
  controller->updateWhitelists(kIfStale, [&] { done = true; });
  EXPECT_FALSE(done);
  EXPECT_EQ(testing::readFile(assistantList()), "");
  queue->drain();
  struct stat st {};
  ASSERT_EQ(stat(assistantList().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  queue->advance(5ms);
  EXPECT_TRUE(done);
}

TEST_F(WhitelistUpdates, IfStaleWithALinkInPlaceOfTheListGoesOn) {
  writeStandardResource();
  fs::create_symlink("/etc/passwd", assistantList());
  EXPECT_TRUE(updateNow(kIfStale));
  EXPECT_TRUE(logs.contains("could not get modify time"));
  // Replaced by the generated list; the link target is untouched.
  EXPECT_FALSE(fs::is_symlink(assistantList()));
}

TEST_F(WhitelistUpdates, DestroyedControllerRunsNothingMore) {
  writeStandardResource();
  bool done = false;
  controller->updateWhitelists(kNow, [&] { done = true; });
  controller.reset();
  queue->advance(1min);
  EXPECT_FALSE(done);
  EXPECT_EQ(querier->calls.size(), 0u);
  EXPECT_EQ(env.transactions->openCount(), 0);
}

// The daemon's wiring: real queue, desktop entries and resource on disk.
TEST(DaemonWhitelistController, GeneratesFromDesktopEntriesOnItsOwnQueue) {
  testing::TestEnvironment env;
  testing::writeFile(env.dirs.dataHome / "applications" / "vendor" / "tool.desktop",
                     "[Desktop Entry]\nType=Application\nName=Tool\n");
  testing::writeFile(env.dirs.dataDirs.at(0) / "applications" / "org.example.Mail.desktop",
                     "[Desktop Entry]\nType=Application\nName=Mail\n");
  testing::writeFile(env.dirs.dataDirs.at(0) / "vireond" / "app-whitelist.json",
                     whitelistDocument({{"org.example.Mail", {{{"encoding_id", 0}}}},
                                        {"vendor-tool", {{{"encoding_id", 9}}}}}));

  auto controller = makeInstalledAppController(env.assembly(), env.dirs);
  std::promise<void> finished;
  controller->updateWhitelists(kNow, [&finished] { finished.set_value(); });
  finished.get_future().get();

  auto signature = env.defaults().stringForKey(kSignatureKey);
  ASSERT_TRUE(signature);
  std::string why;
  auto decoded = testing::decodeSignature(*signature, &why);
  ASSERT_TRUE(decoded) << why;
  EXPECT_EQ(decoded->bitmap, (std::vector<uint8_t>{0x80, 0x40}));
  // The assistant is off: the list is empty.
  EXPECT_EQ(testing::readFile(env.cacheDir() / "assistant-apps.json"), "[]");
}

}  // namespace
}  // namespace fbf
