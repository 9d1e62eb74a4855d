// Usage counting of processed sessions into a real store.

#include "cohorts/usage_processor.h"
#include "cohorts_test_support.h"

namespace fbf::testing {
namespace {

using corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY;
using corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP;
using corevireon::CVClientSession;

const char* kScoutlume = "VIRScoutlumeSession";
const char* kWayfin = "VIRWayfinSession";
const char* kImages = "VIRImagesSession";

// Guards against: a session counted for the wrong surface, twice, without an engagement or search, or a counter past its 16-bit maximum stored instead of stopping.
class UsageCounting : public OpenStore {
 protected:
  void SetUp() override {
    OpenStore::SetUp();
    if (!store) return;
    save();  // the markers staged at bring-up, so that only the processor's records can stay staged
    processor = std::make_unique<UsageProcessor>(*store);
  }
  // The store writes on its own queue: the empty block waits for it.
  void report(const CVClientSession& s) {
    processor->reportUsageEvents(s);
    processor->writePending();
  }
  CVClientSession searched(const char* agent) {
    auto s = makeSession(agent, start);
    addItem(s)->mutable_startlocalsearch()->set_input("weather");
    return s;
  }
  // The one counter record of the entity, as "name=value" for every non-zero
  // counter.
  std::string counters(const std::string& entity) {
    std::string out;
    on([&] {
      auto sessions = store->queryProcessor().usageSessions(entity, SystemTime{}, start + hours(1));
      if (sessions.size() != 1) {
        out = "records: " + std::to_string(sessions.size());
        return;
      }
      for (size_t i = 0; i < sessions[0]->counterCount(); ++i) {
        if (sessions[0]->counter(i) == 0) continue;
        out += (out.empty() ? "" : " ") + std::string(sessions[0]->counterName(i)) + "=" +
               std::to_string(sessions[0]->counter(i));
      }
    });
    return out;
  }

  SystemTime start = utcTime(2030, 4, 2, 9, 30);
  std::unique_ptr<UsageProcessor> processor;
};

TEST_F(UsageCounting, EachSurfaceGetsASentinelAndItsOwnCounterRecordButNewsOnlyASentinel) {
  for (const char* agent : {"Wayfin/17.0", "ScoutLume/3", "Messages/2", "NewsReader/5"}) {
    auto s = searched(agent);
    addResultEngagement(s, ResultFields{});
    report(s);
  }
  EXPECT_EQ(sql("SELECT group_concat(clientIntVal) FROM (SELECT clientIntVal FROM VIRCategory "
                "ORDER BY 1)"),
            "1,2,3,4");
  for (const char* table : {kWayfin, kScoutlume, kImages}) EXPECT_EQ(rows(table), 1) << table;
  EXPECT_EQ(sql("SELECT count(*) FROM VIRUsageEvent WHERE timestamp = " + std::to_string(secondsSinceEpoch(start))),
            "4");
}

ResultFields section(int32_t code) { return ResultFields{.knownSectionBundleIdentifier = code}; }
ResultFields bundle(int32_t code) { return ResultFields{.knownResultBundleId = code}; }

// Each row is one session of a surface, searched unless said otherwise; a
// row expecting no record is a session that must count nothing at all.
TEST_F(UsageCounting, EveryCounterIsReachedByItsEngagementAndNothingElseCounts) {
  using Add = std::function<void(CVClientSession&)>;
  auto engage = [](ResultFields r, corevireon::CVTriggerEngagementEvent t = CV_TRIGGER_ENGAGEMENT_EVENT_TAP) -> Add {
    return [r, t](CVClientSession& s) { addResultEngagement(s, r, t); };
  };
  const Add noResult = [](CVClientSession& s) { addResultEngagement(s, std::nullopt); };
  const Add goToSite = addDidGoToSite, goToSearch = addDidGoToSearch;
  // Previews in the system search surface are not engagements, nor are
  // engagements with another destination.
  const Add previewAndElsewhere = [](CVClientSession& s) {
    addResultEngagement(s, ResultFields{}, corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_HOVER);
    addResultEngagement(s, ResultFields{}, CV_TRIGGER_ENGAGEMENT_EVENT_TAP, 1);
  };
  const Add keystrokeless = [](CVClientSession& s) {
    addItem(s)->mutable_startlocalsearch();
    auto* network = addItem(s)->mutable_startnetworksearch();
    network->set_input("typed");
    network->set_endpoint(12);
    addResultEngagement(s, ResultFields{});
  };
  const ResultFields local{.isLocalApplicationResult = true}, punchout{.punchout = true};
  const auto ret = CV_TRIGGER_ENGAGEMENT_EVENT_RETURN_KEY;
  const char* none = "records: 0";
  const struct {
    const char* agent;
    Add add;
    const char* entity;
    const char* expected;
    bool search = true;
  } cases[] = {
      {"SomeOtherApp/1", engage(ResultFields{}), kWayfin, none},
      {"scoutlume", goToSearch, kScoutlume, "vireon=1"},
      {"scoutlume", noResult, kScoutlume, "other=1"},
      {"scoutlume", engage(bundle(66)), kScoutlume, "querySuggestion=1"},
      {"scoutlume", engage(section(102)), kScoutlume, "vexaSuggestions=1"},
      {"scoutlume", engage(section(103)), kScoutlume, "onDeviceAddressBookData=1"},
      {"scoutlume", engage(section(106)), kScoutlume, "onDeviceOtherPersonalData=1"},
      {"scoutlume", engage(local), kScoutlume, "appLaunch=1"},
      {"scoutlume", engage(section(110)), kScoutlume, "thirdPartyInAppContent=1"},
      {"scoutlume", engage(section(100)), kScoutlume, "vireon=1"},
      {"scoutlume", engage(punchout), kScoutlume, "punchout=1"},
      {"scoutlume", engage(section(7)), kScoutlume, "other=1"},
      {"scoutlume", previewAndElsewhere, kScoutlume, none},
      {"scoutlume", keystrokeless, kScoutlume, none, false},
      {"wayfin", goToSite, kWayfin, "goToSite=1"},
      {"wayfin", goToSite, kWayfin, none, false},
      {"wayfin", goToSearch, kWayfin, "thirdPartyGoto=1"},
      {"wayfin", noResult, kWayfin, "other=1"},
      {"wayfin", engage(bundle(44)), kWayfin, "thirdPartyCompletionOrRecentSearch=1"},
      {"wayfin", engage(section(112), ret), kWayfin, "localGoto=1"},
      {"wayfin", engage(local), kWayfin, "localTap=1"},
      {"wayfin", engage(section(100), ret), kWayfin, "vireonGoto=1"},
      {"wayfin", engage(section(100)), kWayfin, "vireonTap=1"},
      {"wayfin", engage(section(114), ret), kWayfin, "thirdPartyGoto=1"},
      {"wayfin", engage(section(114)), kWayfin, "thirdPartyTap=1"},
      {"wayfin", engage(section(103)), kWayfin, "other=1"},
      {"messages", engage(bundle(86)), kImages, "querySuggestion=1"},
      {"messages", engage(section(101)), kImages, "zkw=1"},
      {"messages", engage(section(5)), kImages, "image=1"},
      {"messages", engage(section(5)), kImages, "image=1", false},
      {"messages", engage(ResultFields{.identifier = std::nullopt}), kImages, "other=1"},
      {"messages", noResult, kImages, "other=1"},
  };
  for (const auto& row : cases) {
    SCOPED_TRACE(std::string(row.agent) + " " + row.expected + (row.search ? "" : " without a search"));
    auto s = row.search ? searched(row.agent) : makeSession(row.agent, start);
    row.add(s);
    report(s);
    EXPECT_EQ(counters(row.entity), row.expected);
    EXPECT_EQ(rows("VIRUsageEvent"), row.expected == none ? 0 : 1);
    bool staged = true;
    on([&] { staged = store->managedObjectContext().hasChanges(); });
    EXPECT_FALSE(staged) << "a staged record stays in memory";
    store->purgeEventsOlderThan(start);
    on([] {});
  }
}

TEST_F(UsageCounting, EveryEngagementIsCountedOnceAndImagesLookUpTheEngagedResultAmongTheShownOnes) {
  auto s = searched("wayfin");
  addDidGoToSite(s);
  addDidGoToSite(s);
  addResultEngagement(s, section(100));
  addResultEngagement(s, std::nullopt);
  report(s);
  EXPECT_EQ(counters(kWayfin), "goToSite=2 vireonTap=1 other=1");
  // The engagement names only the identifier; the shown result says it was
  // a zero-keyword suggestion.
  auto images = makeSession("messages", start);
  addResultEngagement(images, ResultFields{.identifier = "img-7"});
  *addItem(images)->mutable_visibleresults()->add_results() =
      makeResult(ResultFields{.identifier = "img-7", .knownSectionBundleIdentifier = 101});
  addResultEngagement(images, ResultFields{.identifier = "img-8"});
  report(images);
  EXPECT_EQ(counters(kImages), "image=1 zkw=1");
}

TEST_F(UsageCounting, ASessionProcessedAgainIsCountedOnceAndADifferentOneStillCounts) {
  auto s = searched("wayfin");
  addDidGoToSite(s);
  // The same file read again after a crash, then another session of the
  // same surface and start.
  report(s);
  report(s);
  auto other = s;
  addDidGoToSite(other);
  report(other);
  for (const char* table : {"VIRUsageEvent", kWayfin, "VIRCountedSession"}) EXPECT_EQ(rows(table), 2) << table;
  // In one batch: a session counted before, one twice, and new ones; a full
  // batch is written without being asked.
  const size_t fresh = UsageProcessor::kBatchSessions - 2;
  processor->reportUsageEvents(s);
  for (size_t i = 0; i <= fresh; ++i) {
    auto next = other;
    next.set_sessionstart(other.sessionstart() + static_cast<double>(i % fresh + 1));
    processor->reportUsageEvents(next);
  }
  on([] {});
  for (const char* table : {"VIRUsageEvent", kWayfin, "VIRCountedSession"}) {
    EXPECT_EQ(rows(table), static_cast<int>(2 + fresh)) << table;
  }
}

TEST_F(UsageCounting, TheSigned16BitMaximumIsStoredAndOneMoreStopsTheProcess) {
  auto s = searched("wayfin");
  for (int i = 0; i < 32767; ++i) addDidGoToSite(s);
  auto over = s;
  addDidGoToSite(over);
  // First, so that the death test's own run of this test stops here.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(report(over), "engagement counter overflow");
  report(s);
  EXPECT_EQ(counters(kWayfin), "goToSite=32767");
}

}  // namespace
}  // namespace fbf::testing
