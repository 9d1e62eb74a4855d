#include "flushing/reporters.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

using corevireon::CVClient;

// The client surface is read from the agent, first matching rule wins.
TEST(ClientFromAgent, MatchesLowerCasedAgentInRuleOrder) {
  EXPECT_EQ(cohortsClient(std::string_view("Wayfin/1.0")), corevireon::CV_CLIENT_WEB_BROWSER);
  EXPECT_EQ(cohortsClient(std::string_view("SCOUTLUME/17")), corevireon::CV_CLIENT_SYSTEM_SEARCH_UI);
  EXPECT_EQ(cohortsClient(std::string_view("News/8")), corevireon::CV_CLIENT_NEWS);
  EXPECT_EQ(cohortsClient(std::string_view("Messages/17")), corevireon::CV_CLIENT_MESSAGING);
  // "news" is tested before "messages", and both come after the first two.
  EXPECT_EQ(cohortsClient(std::string_view("MessagesNews")), corevireon::CV_CLIENT_NEWS);
  EXPECT_EQ(cohortsClient(std::string_view("news scoutlume")), corevireon::CV_CLIENT_SYSTEM_SEARCH_UI);
  EXPECT_EQ(cohortsClient(std::string_view("scoutlume wayfin")), corevireon::CV_CLIENT_WEB_BROWSER);
}

TEST(ClientFromAgent, AbsentEmptyOrUnknownAgentIsNone) {
  EXPECT_EQ(cohortsClient(std::nullopt), corevireon::CV_CLIENT_NONE);
  EXPECT_EQ(cohortsClient(std::string_view("")), corevireon::CV_CLIENT_NONE);
  EXPECT_EQ(cohortsClient(std::string_view("Mail/16")), corevireon::CV_CLIENT_NONE);
  corevireon::CVClientSession session;
  EXPECT_EQ(cohortsClient(session), corevireon::CV_CLIENT_NONE);
  session.set_agent("wayfin");
  EXPECT_EQ(cohortsClient(session), corevireon::CV_CLIENT_WEB_BROWSER);
}

TEST(PreviewTriggerEvents, AreNineEightAndThree) {
  EXPECT_EQ(triggerEventScoutlumePreviewTypes(), (std::set<int32_t>{3, 8, 9}));
}

class ResultEngagementCounting : public ::testing::Test {
 protected:
  static EngagementReporter engagement(int trigger, int destination) {
    corevireon::CVResultEngagementFeedback m;
    m.set_triggerevent(static_cast<corevireon::CVTriggerEngagementEvent>(trigger));
    m.set_destination(destination);
    return *EngagementReporter::from(m);
  }
};

TEST_F(ResultEngagementCounting, PreviewInSystemSearchIsNotAnEngagementElsewhereItIs) {
  for (int trigger : {3, 8, 9}) {
    EXPECT_FALSE(engagement(trigger, 0).isEngagement(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI));
    EXPECT_TRUE(engagement(trigger, 0).isEngagement(corevireon::CV_CLIENT_NONE));
    EXPECT_TRUE(engagement(trigger, 0).isEngagement(corevireon::CV_CLIENT_WEB_BROWSER));
  }
  EXPECT_TRUE(engagement(1, 0).isEngagement(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI));
}

TEST_F(ResultEngagementCounting, DestinationOneInSystemSearchIsNotAnEngagement) {
  EXPECT_FALSE(engagement(1, 1).isEngagement(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI));
  EXPECT_TRUE(engagement(1, 2).isEngagement(corevireon::CV_CLIENT_SYSTEM_SEARCH_UI));
  EXPECT_TRUE(engagement(1, 1).isEngagement(corevireon::CV_CLIENT_NEWS));
}

TEST(GoToEngagements, CountOnlyForTheirSurfaces) {
  auto site = *EngagementReporter::from(corevireon::CVDidGoToSiteFeedback());
  auto search = *EngagementReporter::from(corevireon::CVDidGoToSearchFeedback());
  for (int c = 0; c <= 4; ++c) {
    auto client = static_cast<CVClient>(c);
    EXPECT_EQ(site.isEngagement(client), c == 1) << c;
    EXPECT_EQ(search.isEngagement(client), c == 1 || c == 2) << c;
  }
  EXPECT_FALSE(EngagementReporter::from(corevireon::CVClearInputFeedback()));
}

TEST(Keystrokes, NeedInputAndNetworkEndpoint12NeverCounts) {
  corevireon::CVStartLocalSearchFeedback local;
  EXPECT_FALSE(KeystrokeReporter::from(local)->isKeystroke());
  local.set_input("");
  EXPECT_FALSE(KeystrokeReporter::from(local)->isKeystroke());
  local.set_input("a");
  EXPECT_TRUE(KeystrokeReporter::from(local)->isKeystroke());

  corevireon::CVStartNetworkSearchFeedback network;
  network.set_input("pasta");
  network.set_endpoint(3);
  EXPECT_TRUE(KeystrokeReporter::from(network)->isKeystroke());
  network.set_endpoint(12);
  EXPECT_FALSE(KeystrokeReporter::from(network)->isKeystroke());
  EXPECT_FALSE(KeystrokeReporter::from(corevireon::CVEndLocalSearchFeedback()));
}

TEST(Rankings, OnlyRankingFeedbackIsARankingReporter) {
  corevireon::CVRankingFeedback ranking;
  auto* r = ranking.add_sections()->mutable_section()->mutable_results()->add_items();
  r->set_identifier("x");
  auto reporter = RankingReporter::from(ranking);
  ASSERT_TRUE(reporter);
  ASSERT_EQ(reporter->containedResults().size(), 1u);
  EXPECT_EQ(reporter->containedResults()[0]->identifier(), "x");
  EXPECT_FALSE(RankingReporter::from(corevireon::CVSectionRankingFeedback()));
}

}  // namespace
}  // namespace fbf
