// Cohort envelopes built from a real store: what each period writes, what
// the listener sees, the lookback, the shares and the bucketing.

#include "cohorts/cohort_feedback_generator.h"
#include "cohorts/cohorts_usage_store.h"
#include "cohorts_test_support.h"

#include <unicode/locid.h>

namespace fbf::testing {
namespace {

using corevireon::CVCohortsFeedback;
using corevireon::CVUsageEnvelope;

int64_t wholeSeconds(SystemTime t) { return static_cast<int64_t>(secondsSinceEpoch(t)); }

CVCohortsFeedback decode(const std::string& bytes) {
  CVCohortsFeedback f;
  EXPECT_TRUE(f.ParseFromString(bytes));
  return f;
}

// "client:active days/lookback days" of each usage envelope.
std::vector<std::string> summaries(const std::vector<CVUsageEnvelope>& envelopes) {
  std::vector<std::string> out;
  for (const auto& e : envelopes) {
    out.push_back(std::to_string(e.client()) + ":" + std::to_string(e.usagesincelookback().activedaysincollectionperiod()) +
                  "/" + std::to_string(e.configuredlookbacktimeindays()));
  }
  return out;
}

// Guards against: envelopes for the wrong period, client order, lookback or active days; markers not advanced; shares or engagement totals computed or formatted wrongly; files or listener calls missing.
class CohortEnvelopes : public OpenStore {
 protected:
  CohortEnvelopes() : OpenStore("America/New_York") {}
  std::unique_ptr<CohortFeedbackGenerator> makeGenerator(std::optional<ConfigurationBag> bag = std::nullopt,
                                                         const char* locale = "en_US") {
    CohortFeedbackGenerator::Collaborators c;
    c.bag = std::move(bag);
    c.deviceContext = &env.assembly().deviceContext();
    c.today = localTime(2030, 12, 31);
    c.calendar = CohortCalendar("America/New_York", locale);
    c.random = std::make_shared<SeededRandomSource>(7);
    c.persist = [this](const std::string& bytes) { persisted.push_back(decode(bytes)); };
    c.offer = [this](const std::string& bytes) { offered.push_back(bytes); };
    return std::make_unique<CohortFeedbackGenerator>(*store, std::move(c));
  }
  std::vector<CVUsageEnvelope> usageEnvelopes() const {
    std::vector<CVUsageEnvelope> out;
    for (const auto& f : persisted) {
      if (f.whichKind_case() == CVCohortsFeedback::kUsageEnvelope) out.push_back(f.usageenvelope());
    }
    return out;
  }
  std::vector<CVUsageEnvelope> usageFiles() const {
    std::vector<CVUsageEnvelope> out;
    for (const auto& entry : fs::directory_iterator(env.cacheDir() / "CustomFeedback" / "Usage")) {
      EXPECT_EQ(entry.path().filename().string().rfind("cohorts.", 0), 0u) << entry.path();
      EXPECT_EQ(env.fileManager->attributes(entry.path()).value().mode, 0600u);
      out.push_back(decode(readFile(entry.path())).usageenvelope());
    }
    return out;
  }

  std::vector<CVCohortsFeedback> persisted;
  std::vector<std::string> offered;
};

// A run with Monday weeks, then runs with Sunday weeks: the first Sunday
// week after the change starts where the Monday week ended.
TEST_F(CohortEnvelopes, AChangeOfWeekRuleBetweenRunsNeitherOverlapsNorSkips) {
  setMarker(FlushFrequency::weekly, localTime(2030, 5, 29, 10));
  makeGenerator(std::nullopt, "de_DE")->aggregateNext(FlushFrequency::weekly);
  EXPECT_EQ(marker(FlushFrequency::weekly), localTime(2030, 6, 3)) << "a Monday week";
  for (auto [end, days] : {std::pair{localTime(2030, 6, 9), 6}, std::pair{localTime(2030, 6, 16), 7}}) {
    persisted.clear();
    makeGenerator(std::nullopt, "en_US")->aggregateNext(FlushFrequency::weekly);
    EXPECT_EQ(marker(FlushFrequency::weekly), end);
    ASSERT_FALSE(usageEnvelopes().empty());
    EXPECT_EQ(usageEnvelopes()[0].configuredlookbacktimeindays(), days);
  }
}

TEST_F(CohortEnvelopes, AWeekCountsDistinctLocalDaysInsideItsRange) {
  // Saturday before; Sunday's first instant and evening; Tuesday; Saturday's
  // last minute; the next Sunday.
  for (SystemTime t : {localTime(2030, 6, 1, 23, 59), localTime(2030, 6, 2), localTime(2030, 6, 2, 20),
                       localTime(2030, 6, 4, 7), localTime(2030, 6, 8, 23, 59), localTime(2030, 6, 9)}) {
    addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, t);
  }
  setMarker(FlushFrequency::weekly, localTime(2030, 6, 2));  // the end of the week before
  save();
  makeGenerator()->aggregateNext(FlushFrequency::weekly);
  EXPECT_EQ(summaries(usageEnvelopes()), (std::vector<std::string>{"2:0/7", "1:3/7", "4:0/7", "3:0/7"}));
  EXPECT_EQ(marker(FlushFrequency::weekly), localTime(2030, 6, 9));
}

// Shares are rounded from the raw counts and written with a full stop even
// where the locale uses a comma; the total is bucketed by fifty.
TEST_F(CohortEnvelopes, AMonthAlsoWritesLookbackUsageAndOnePropensityEnvelope) {
  addSentinel(corevireon::CV_CLIENT_WEB_BROWSER, localTime(2030, 2, 10, 12));  // lookback only
  addWayfinSession(localTime(2030, 2, 10, 12), {{VIRWayfinSession::goToSite, 101}, {VIRWayfinSession::other, 202}});
  addWayfinSession(localTime(2030, 2, 3, 12), {{VIRWayfinSession::localTap, 9}});  // before the lookback
  setMarker(FlushFrequency::monthly, localTime(2030, 3, 1));
  save();
  icu::Locale previous = icu::Locale::getDefault();
  UErrorCode status = U_ZERO_ERROR;
  icu::Locale::setDefault(icu::Locale("de_DE"), status);
  makeGenerator()->aggregateNext(FlushFrequency::monthly);
  icu::Locale::setDefault(previous, status);

  ASSERT_EQ(persisted.size(), 9u);
  EXPECT_EQ(summaries(usageEnvelopes()), (std::vector<std::string>{"2:0/31", "1:0/31", "4:0/31", "3:0/31", "2:0/56",
                                                                    "1:1/56", "4:0/56", "3:0/56"}));
  EXPECT_EQ(usageEnvelopes()[5].collectionendtimestamp(), wholeSeconds(localTime(2030, 4, 1)));

  ASSERT_EQ(persisted.back().whichKind_case(), CVCohortsFeedback::kPropensityEnvelope);
  auto p = persisted.back().propensityenvelope();
  EXPECT_EQ(p.uuid().size(), 16u);
  EXPECT_EQ(p.collectionstarttimestamp(), wholeSeconds(store->collectionStartDate()));
  p.clear_uuid();
  p.clear_collectionstarttimestamp();
  // Ends 1 April 2030 in New York. No engagement with a surface, no message
  // for it; news has no counters.
  EXPECT_EQ(p.ShortDebugString(),
            "context { localeIdentifier: \"en_US\" country: \"US\" deviceModel: \"TestBox1,1\" osVersion: \"1A100\" } "
            "collectionEndTimestamp: 1901246400 configuredLookbackTimeInDays: 56 wayfinUsagePropensity { goToSite: "
            "\"0.33\" localGoto: \"0\" localTap: \"0\" vireonGoto: \"0\" vireonTap: \"0\" "
            "thirdPartyCompletionOrRecentSearch: \"0\" thirdPartyGoto: \"0\" thirdPartyTap: \"0\" other: \"0.67\" "
            "totalEngagements: 300 } newsUsagePropensity { }");
  EXPECT_EQ(offered.size(), 8u) << "only usage envelopes go to the listener";
  EXPECT_EQ(marker(FlushFrequency::monthly), localTime(2030, 4, 1));
}

// A damaged store can hold counts no 32-bit total holds: that surface's
// propensity is left out with an error line, the rest of the report stays,
// down to a surface engaged with once.
TEST_F(CohortEnvelopes, AnEngagementTotalBeyond32BitsLeavesThatSurfaceOut) {
  addWayfinSession(localTime(2030, 3, 10, 12), {{VIRWayfinSession::goToSite, 1}});
  on([&] {
    auto s = store->eventFactory().createScoutlumeSession();
    s->setTimestamp(localTime(2030, 3, 10, 12));
    s->incrementCounter(VIRScoutlumeSession::appLaunch);
  });
  setMarker(FlushFrequency::monthly, localTime(2030, 3, 1));
  save();
  ASSERT_TRUE(RawDatabase(databasePath()).exec("UPDATE VIRWayfinSession SET goToSite = 5000000000"));
  LogCapture logs;
  makeGenerator()->aggregateNext(FlushFrequency::monthly);
  ASSERT_FALSE(persisted.empty());
  ASSERT_EQ(persisted.back().whichKind_case(), CVCohortsFeedback::kPropensityEnvelope);
  EXPECT_FALSE(persisted.back().propensityenvelope().has_wayfinusagepropensity());
  EXPECT_TRUE(persisted.back().propensityenvelope().has_newsusagepropensity());
  EXPECT_EQ(persisted.back().propensityenvelope().scoutlumeusagepropensity().totalengagements(), 1);
  EXPECT_TRUE(logs.contains("Total engagements of VIRWayfinSession do not fit a 32-bit integer"));
}

// Guards against: engagement counts rounded at the wrong edge, or a zero bucket dividing silently.
TEST(EngagementBuckets, BelowTheBucketExactAboveRoundedDown) {
  const std::pair<uint64_t, uint64_t> rows[] = {{0, 0}, {49, 49}, {50, 50}, {51, 50}, {149, 100}};
  for (auto [count, bucketed] : rows) EXPECT_EQ(CohortFeedbackGenerator::bucketEngagementCount(count, 50), bucketed);
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(CohortFeedbackGenerator::bucketEngagementCount(0, 0), "bucket size of zero");
}

// Guards against: the flush aggregating days not yet due, skipping due ones, purging what a pending month still needs, writing files others can read, calling the listener off the work queue, or not counting sessions.
TEST_F(CohortEnvelopes, TheCohortFlushAggregatesDueDaysIntoFilesAndPurgesOnlyWhatNoPeriodNeeds) {
  fs::create_directories(env.cacheDir() / "CustomFeedback");
  auto listener = std::make_shared<RecordingConduit>();
  env.assembly().setCohortsListener(listener);
  env.writeBag({{"cohorts_lookback_in_days", 7}});
  setAllMarkers(localTime(2030, 6, 10, 12));
  addSentinel(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, localTime(2030, 4, 1));  // long gone
  addSentinel(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, localTime(2030, 6, 1));  // this month's
  addSentinel(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, localTime(2030, 6, 10, 13));
  save();
  env.clock->set(localTime(2030, 6, 12, 6));

  CohortsUsageStore usage(env.assembly(), std::move(store), std::make_shared<SeededRandomSource>(5));
  FlushUsageStore& flush = usage;
  flush.flushCohortsFeedback();
  onStore(usage.store(), [] {});

  auto envelopes = usageFiles();
  // 10 June is certain (30 hours ago); 11 June ended 6 hours ago.
  ASSERT_TRUE(envelopes.size() == 4u || envelopes.size() == 8u) << envelopes.size();
  EXPECT_TRUE(listener->received.empty()) << "delivered on the work queue, not the store's";
  env.manualQueue->drain();
  ASSERT_EQ(listener->received.size(), envelopes.size());
  EXPECT_EQ(std::count_if(envelopes.begin(), envelopes.end(), [](const CVUsageEnvelope& e) {
              return e.client() == 2 && e.collectionendtimestamp() == wholeSeconds(localTime(2030, 6, 11)) &&
                     e.usagesincelookback().activedaysincollectionperiod() == 1;
            }), 1) << "10 June's searches, in their envelope";
  // The month of June is still to be aggregated and needs its lookback: the
  // 1 June sentinel stays, the April one is purged.
  EXPECT_EQ(rows("VIRUsageEvent"), 2);
  EXPECT_EQ(sql("SELECT count(*) FROM VIRUsageEvent WHERE timestamp < " +
                std::to_string(secondsSinceEpoch(localTime(2030, 5, 1)))),
            "0");

  auto session = makeSession("Messages", localTime(2030, 6, 1, 8));
  addResultEngagement(session, ResultFields{});
  flush.usageEventSink()->reportUsageEvents(session);
  usage.usageProcessor().writePending();
  EXPECT_EQ(rows("VIRImagesSession"), 1);
  flush.resetRowCache();
}

}  // namespace
}  // namespace fbf::testing
