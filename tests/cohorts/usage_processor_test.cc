// Usage counting of processed sessions into a real store.

#include "cohorts/usage_processor.h"
#include "cohorts_test_support.h"

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

using corevireon::CVClient;

class UsageCounting : public StoreFixture {
 protected:
  void SetUp() override {
    makeCohortsDirectory();
    store = bringUpAndSettle();
    ASSERT_NE(store, nullptr);
    processor = std::make_unique<UsageProcessor>(*store);
  }
  RawDatabase& raw() {
    if (!raw_) raw_ = std::make_unique<RawDatabase>(databasePath());
    return *raw_;
  }
  // The one counter record of the entity, as "name=value" for every non-zero
  // counter.
  std::string counters(const std::string& entity) {
    std::string out;
    onStore(*store, [&] {
      auto sessions = store->queryProcessor().usageSessions(entity, SystemTime{}, start + hours(1));
      if (sessions.size() != 1) {
        out = "records: " + std::to_string(sessions.size());
        return;
      }
      for (size_t i = 0; i < sessions[0]->counterCount(); ++i) {
        if (sessions[0]->counter(i) == 0) continue;
        if (!out.empty()) out += " ";
        out += std::string(sessions[0]->counterName(i)) + "=" + std::to_string(sessions[0]->counter(i));
      }
    });
    return out;
  }

  SystemTime start = utcTime(2030, 4, 2, 9, 30);
  std::unique_ptr<ObjectGraphStorageContainer> store;
  std::unique_ptr<UsageProcessor> processor;
  std::unique_ptr<RawDatabase> raw_;
};

TEST_F(UsageCounting, EachSurfaceGetsASentinelAndItsOwnCounterRecord) {
  for (const char* agent : {"Wayfin/17.0", "ScoutLume/3", "Messages/2"}) {
    auto s = makeSession(agent, start);
    addSearch(s);
    addResultEngagement(s, ResultSpec{});
    processor->reportUsageEvents(s);
  }
  EXPECT_EQ(raw().scalar("SELECT group_concat(clientIntVal) FROM (SELECT clientIntVal FROM VIRCategory ORDER BY 1)"),
            "1,2,3");
  EXPECT_EQ(raw().count("VIRWayfinSession"), 1);
  EXPECT_EQ(raw().count("VIRScoutlumeSession"), 1);
  EXPECT_EQ(raw().count("VIRImagesSession"), 1);
  EXPECT_EQ(raw().scalar("SELECT timestamp = " + std::to_string(secondsSinceEpoch(start)) + " FROM VIRUsageEvent LIMIT 1"),
            "1");
}

TEST_F(UsageCounting, ANewsSessionGetsASentinelButNoCounterRecord) {
  auto s = makeSession("NewsReader/5", start);
  addSearch(s);
  addResultEngagement(s, ResultSpec{});
  processor->reportUsageEvents(s);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 1);
  EXPECT_EQ(raw().scalar("SELECT clientIntVal FROM VIRCategory"), "4");
  EXPECT_EQ(raw().count("VIRWayfinSession") + raw().count("VIRScoutlumeSession") + raw().count("VIRImagesSession"), 0);
}

TEST_F(UsageCounting, AMessagesSessionCountsWithoutSearchesButABrowserSessionDoesNot) {
  auto messages = makeSession("messages", start);
  addResultEngagement(messages, ResultSpec{});
  processor->reportUsageEvents(messages);
  auto browser = makeSession("wayfin", start);
  addDidGoToSite(browser);
  processor->reportUsageEvents(browser);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 1);
  EXPECT_EQ(raw().scalar("SELECT clientIntVal FROM VIRCategory"), "3");
  EXPECT_EQ(raw().count("VIRWayfinSession"), 0);
}

TEST_F(UsageCounting, ASessionWithoutEngagementsCountsNothing) {
  auto s = makeSession("scoutlume", start);
  addSearch(s);
  // Previews in the system search surface are not engagements.
  addResultEngagement(s, ResultSpec{}, corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_HOVER);
  addResultEngagement(s, ResultSpec{}, corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP, 1);
  processor->reportUsageEvents(s);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 0);
  EXPECT_EQ(raw().count("VIRScoutlumeSession"), 0);
}

TEST_F(UsageCounting, AnUnknownAgentStagesNothingButStillSaves) {
  auto s = makeSession("SomeOtherApp/1", start);
  addSearch(s);
  addResultEngagement(s, ResultSpec{});
  processor->reportUsageEvents(s);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 0);
  // The save wrote the aggregation markers staged at bring-up.
  EXPECT_EQ(raw().count("VIRFlushEvent"), 3);
  onStore(*store, [&] { EXPECT_FALSE(store->managedObjectContext().hasChanges()); });
}

TEST_F(UsageCounting, KeystrokelessSearchStartsAreNotSearches) {
  auto s = makeSession("scoutlume", start);
  s.mutable_feedbacks()->add_items()->mutable_startlocalsearch();
  auto* network = s.mutable_feedbacks()->add_items()->mutable_startnetworksearch();
  network->set_input("typed");
  network->set_endpoint(12);
  addResultEngagement(s, ResultSpec{});
  processor->reportUsageEvents(s);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 0);
}

TEST(UsageRule, OnFlags) {
  EXPECT_FALSE(UsageProcessor::session(true, false, corevireon::CV_CLIENT_MESSAGING));
  EXPECT_TRUE(UsageProcessor::session(false, true, corevireon::CV_CLIENT_MESSAGING));
  EXPECT_FALSE(UsageProcessor::session(false, true, corevireon::CV_CLIENT_WEB_BROWSER));
  EXPECT_TRUE(UsageProcessor::session(true, true, corevireon::CV_CLIENT_NEWS));
  EXPECT_FALSE(UsageProcessor::session(true, true, corevireon::CV_CLIENT_NONE));
}

// --- Every counter is reachable -------------------------------------------

struct CounterCase {
  const char* name;
  const char* agent;
  std::function<void(corevireon::CVClientSession&)> engage;
  const char* entity;
  const char* expected;
};

void PrintTo(const CounterCase& c, std::ostream* os) { *os << c.name; }

using corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY;
using corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP;

ResultSpec section(int32_t code) { return ResultSpec{.knownSectionBundleIdentifier = code}; }
ResultSpec bundle(int32_t code) { return ResultSpec{.knownResultBundleId = code}; }
ResultSpec local() { return ResultSpec{.isLocalApplicationResult = true}; }
ResultSpec punchout() { return ResultSpec{.punchout = true}; }

auto engage(ResultSpec r, corevireon::CVTriggerEngagementEvent t = CV_TRIGGER_ENGAGEMENT_EVENT_TAP) {
  return [r, t](corevireon::CVClientSession& s) { addResultEngagement(s, r, t); };
}
auto engageWithoutResult() {
  return [](corevireon::CVClientSession& s) { addResultEngagement(s, std::nullopt); };
}

class EveryCounter : public UsageCounting, public ::testing::WithParamInterface<CounterCase> {};

TEST_P(EveryCounter, IsReachedByItsEngagement) {
  const auto& c = GetParam();
  auto s = makeSession(c.agent, start);
  addSearch(s);
  c.engage(s);
  processor->reportUsageEvents(s);
  EXPECT_EQ(counters(c.entity), c.expected);
}

const char* kScoutlume = "VIRScoutlumeSession";
const char* kWayfin = "VIRWayfinSession";
const char* kImages = "VIRImagesSession";

INSTANTIATE_TEST_SUITE_P(
    Classification, EveryCounter,
    ::testing::Values(
        CounterCase{"scoutlumeGoToSearch", "scoutlume", [](auto& s) { addDidGoToSearch(s); }, kScoutlume, "vireon=1"},
        CounterCase{"scoutlumeNoResult", "scoutlume", engageWithoutResult(), kScoutlume, "other=1"},
        CounterCase{"scoutlumeSuggestion", "scoutlume", engage(bundle(66)), kScoutlume, "querySuggestion=1"},
        CounterCase{"scoutlumeAssistant", "scoutlume", engage(section(102)), kScoutlume, "vexaSuggestions=1"},
        CounterCase{"scoutlumeContacts", "scoutlume", engage(section(103)), kScoutlume, "onDeviceAddressBookData=1"},
        CounterCase{"scoutlumeNotes", "scoutlume", engage(section(106)), kScoutlume, "onDeviceOtherPersonalData=1"},
        CounterCase{"scoutlumeApp", "scoutlume", engage(local()), kScoutlume, "appLaunch=1"},
        CounterCase{"scoutlumeInApp", "scoutlume", engage(section(110)), kScoutlume, "thirdPartyInAppContent=1"},
        CounterCase{"scoutlumeServer", "scoutlume", engage(section(100)), kScoutlume, "vireon=1"},
        CounterCase{"scoutlumePunchout", "scoutlume", engage(punchout()), kScoutlume, "punchout=1"},
        CounterCase{"scoutlumeOther", "scoutlume", engage(section(7)), kScoutlume, "other=1"},
        CounterCase{"wayfinSite", "wayfin", [](auto& s) { addDidGoToSite(s); }, kWayfin, "goToSite=1"},
        CounterCase{"wayfinSearch", "wayfin", [](auto& s) { addDidGoToSearch(s); }, kWayfin, "thirdPartyGoto=1"},
        CounterCase{"wayfinNoResult", "wayfin", engageWithoutResult(), kWayfin, "other=1"},
        CounterCase{"wayfinCompletion", "wayfin", engage(bundle(44)), kWayfin, "thirdPartyCompletionOrRecentSearch=1"},
        CounterCase{"wayfinLocalGoto", "wayfin", engage(section(112), CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY), kWayfin,
                    "localGoto=1"},
        CounterCase{"wayfinLocalTap", "wayfin", engage(local()), kWayfin, "localTap=1"},
        CounterCase{"wayfinServerGoto", "wayfin", engage(section(100), CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY), kWayfin,
                    "vireonGoto=1"},
        CounterCase{"wayfinServerTap", "wayfin", engage(section(100)), kWayfin, "vireonTap=1"},
        CounterCase{"wayfinEngineGoto", "wayfin", engage(section(114), CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY), kWayfin,
                    "thirdPartyGoto=1"},
        CounterCase{"wayfinEngineTap", "wayfin", engage(section(114)), kWayfin, "thirdPartyTap=1"},
        CounterCase{"wayfinOther", "wayfin", engage(section(103)), kWayfin, "other=1"},
        CounterCase{"imagesSuggestion", "messages", engage(bundle(86)), kImages, "querySuggestion=1"},
        CounterCase{"imagesZeroKeyword", "messages", engage(section(101)), kImages, "zkw=1"},
        CounterCase{"imagesImage", "messages", engage(section(5)), kImages, "image=1"},
        CounterCase{"imagesNoIdentifier", "messages", engage(ResultSpec{.identifier = std::nullopt}), kImages,
                    "other=1"},
        CounterCase{"imagesNoResult", "messages", engageWithoutResult(), kImages, "other=1"}),
    [](const ::testing::TestParamInfo<CounterCase>& info) { return std::string(info.param.name); });

TEST_F(UsageCounting, ImagesLookUpTheEngagedResultAmongTheSessionsResults) {
  auto s = makeSession("messages", start);
  // The engagement names only the identifier; the shown result says it was
  // a zero-keyword suggestion.
  addResultEngagement(s, ResultSpec{.identifier = "img-7"});
  addVisibleResult(s, ResultSpec{.identifier = "img-7", .knownSectionBundleIdentifier = 101});
  addResultEngagement(s, ResultSpec{.identifier = "img-8"});
  processor->reportUsageEvents(s);
  EXPECT_EQ(counters(kImages), "image=1 zkw=1");
}

TEST_F(UsageCounting, EveryEngagementOfASessionIsCountedOnce) {
  auto s = makeSession("wayfin", start);
  addSearch(s);
  addDidGoToSite(s);
  addDidGoToSite(s);
  addResultEngagement(s, section(100));
  addResultEngagement(s, std::nullopt);
  processor->reportUsageEvents(s);
  EXPECT_EQ(counters(kWayfin), "goToSite=2 vireonTap=1 other=1");
}

TEST_F(UsageCounting, ASessionProcessedAgainIsCountedOnceAndADifferentOneStillCounts) {
  auto s = makeSession("wayfin", start);
  addSearch(s);
  addDidGoToSite(s);
  // The same file read again after a crash, then another session of the
  // same surface and start.
  processor->reportUsageEvents(s);
  processor->reportUsageEvents(s);
  auto other = s;
  addDidGoToSite(other);
  processor->reportUsageEvents(other);
  EXPECT_EQ(raw().count("VIRUsageEvent"), 2);
  EXPECT_EQ(raw().count("VIRWayfinSession"), 2);
  EXPECT_EQ(raw().count("VIRCountedSession"), 2);
}

TEST(UsageCounterOverflow, PassingTheSigned16BitMaximumStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        ScopedTimeZone zone("UTC");
        TestEnvironment env;
        fs::create_directories(env.cacheDir() / "Cohorts");
        auto store = ObjectGraphStorageContainer::make(*env.fileManager, [] { return SystemTime{}; }, {});
        UsageProcessor processor(*store);
        auto s = makeSession("wayfin", utcTime(2030, 1, 1));
        addSearch(s);
        for (int i = 0; i < 32768; ++i) addDidGoToSite(s);
        processor.reportUsageEvents(s);
      },
      "engagement counter overflow");
}

TEST_F(UsageCounting, TheSigned16BitMaximumItselfIsStored) {
  auto s = makeSession("wayfin", start);
  addSearch(s);
  for (int i = 0; i < 32767; ++i) addDidGoToSite(s);
  processor->reportUsageEvents(s);
  EXPECT_EQ(counters(kWayfin), "goToSite=32767");
}

}  // namespace
}  // namespace fbf::testing
