#include "flushing/reporters.h"
#include "processing/processing_builders.h"

namespace fbf::testing {
namespace {

using corevireon::CVClient;

// Guards against: an agent read as the wrong client surface (case, rule order, absent agent).
TEST(ClientFromAgent, MatchesTheLowerCasedAgentFirstRuleWins) {
  const std::pair<std::optional<std::string_view>, CVClient> rows[] = {
      {"Wayfin/1.0", corevireon::CV_CLIENT_WEB_BROWSER},       {"SCOUTLUME/17", corevireon::CV_CLIENT_SYSTEM_SEARCH_UI},
      {"News/8", corevireon::CV_CLIENT_NEWS},                  {"Messages/17", corevireon::CV_CLIENT_MESSAGING},
      {"MessagesNews", corevireon::CV_CLIENT_NEWS},            {"news scoutlume", corevireon::CV_CLIENT_SYSTEM_SEARCH_UI},
      {"scoutlume wayfin", corevireon::CV_CLIENT_WEB_BROWSER}, {std::nullopt, corevireon::CV_CLIENT_NONE},
      {"", corevireon::CV_CLIENT_NONE},                        {"Mail/16", corevireon::CV_CLIENT_NONE},
  };
  for (const auto& [agent, client] : rows) EXPECT_EQ(cohortsClient(agent), client) << agent.value_or("<none>");
}

// Guards against: previews, destination 1 or go-to feedback counted as engagements on the wrong surface.
TEST(Engagements, DependOnTriggerDestinationAndSurface) {
  using Row = std::tuple<int, int, CVClient, bool>;  // trigger, destination, surface, counts as an engagement
  std::vector<Row> rows = {{1, 0, corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, true},
                           {1, 1, corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, false},
                           {1, 2, corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, true},
                           {1, 1, corevireon::CV_CLIENT_NEWS, true}};
  for (int preview : {3, 8, 9}) {
    rows.emplace_back(preview, 0, corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, false);
    rows.emplace_back(preview, 0, corevireon::CV_CLIENT_NONE, true);
    rows.emplace_back(preview, 0, corevireon::CV_CLIENT_WEB_BROWSER, true);
  }
  for (int other : {2, 4, 7}) rows.emplace_back(other, 0, corevireon::CV_CLIENT_SYSTEM_SEARCH_UI, true);
  for (const auto& [trigger, destination, client, engagement] : rows) {
    auto m = pb<corevireon::CVResultEngagementFeedback>("triggerEvent: " + std::to_string(trigger) +
                                                        " destination: " + std::to_string(destination));
    EXPECT_EQ(EngagementReporter::from(m)->isEngagement(client), engagement)
        << "trigger " << trigger << " destination " << destination << " client " << client;
  }
  const corevireon::CVDidGoToSiteFeedback siteFeedback;
  const corevireon::CVDidGoToSearchFeedback searchFeedback;
  auto site = *EngagementReporter::from(siteFeedback);
  auto search = *EngagementReporter::from(searchFeedback);
  for (int c = 0; c <= 4; ++c) {
    EXPECT_EQ(site.isEngagement(static_cast<CVClient>(c)), c == 1) << c;
    EXPECT_EQ(search.isEngagement(static_cast<CVClient>(c)), c == 1 || c == 2) << c;
  }
  const corevireon::CVClearInputFeedback clear;
  EXPECT_FALSE(EngagementReporter::from(clear));
}

// Guards against: a search without input, or to network endpoint 12, counted as a keystroke.
TEST(Keystrokes, NeedInputAndNetworkEndpoint12NeverCounts) {
  corevireon::CVStartLocalSearchFeedback local;
  EXPECT_FALSE(KeystrokeReporter::from(local)->isKeystroke());
  local.set_input("");
  EXPECT_FALSE(KeystrokeReporter::from(local)->isKeystroke());
  local.set_input("a");
  EXPECT_TRUE(KeystrokeReporter::from(local)->isKeystroke());
  corevireon::CVStartNetworkSearchFeedback network;
  network.set_input("pasta");
  for (int endpoint : {3, 11, 13}) {
    network.set_endpoint(endpoint);
    EXPECT_TRUE(KeystrokeReporter::from(network)->isKeystroke()) << endpoint;
  }
  network.set_endpoint(12);
  EXPECT_FALSE(KeystrokeReporter::from(network)->isKeystroke());
  const corevireon::CVEndLocalSearchFeedback end;
  EXPECT_FALSE(KeystrokeReporter::from(end));
}

}  // namespace
}  // namespace fbf::testing
