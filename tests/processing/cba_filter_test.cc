#include "flushing/cba_filter_controller.h"
#include "flushing/url_matching.h"
#include "processing/processing_builders.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

using namespace fbf::testing;

constexpr int kNoMatch = 0, kSameSite = 1, kIgnoringQuery = 2, kSameAddress = 3;

int match(std::optional<std::string_view> shown, std::optional<std::string_view> visited) {
  return cbaMatchBetween(shown, visited);
}

// The match levels between a shown address and a visited one.
TEST(MatchLevels, SameAddressApartFromSchemeSubdomainAndTrailingSlash) {
  EXPECT_EQ(match("https://www.example.com/recipes/pasta", "http://m.example.com/recipes/pasta/"), kSameAddress);
  EXPECT_EQ(match("https://example.com", "https://example.com/"), kSameAddress);
  EXPECT_EQ(match("https://WWW.Example.COM/a", "https://example.com/a"), kSameAddress);
  EXPECT_EQ(match("https://news.bbc.co.uk/x", "https://www.bbc.co.uk/x"), kSameAddress);
}

TEST(MatchLevels, ExtraQueryOnEitherSideGivesTwo) {
  EXPECT_EQ(match("https://www.example.com/a", "https://example.com/a?utm_source=x"), kIgnoringQuery);
  EXPECT_EQ(match("https://www.example.com/a?id=1", "https://example.com/a/"), kIgnoringQuery);
  EXPECT_EQ(match("https://example.com/a?id=1", "https://example.com/a?id=2"), kIgnoringQuery);
}

TEST(MatchLevels, SameSiteNameUnderAnotherSuffixOrPathGivesOne) {
  EXPECT_EQ(match("https://www.example.com/a", "https://example.com/b"), kSameSite);
  EXPECT_EQ(match("https://www.example.com/a", "https://shop.example.co.uk/"), kSameSite);
  EXPECT_EQ(match("https://www.example.com/a#top", "https://example.com/a#bottom"), kSameSite);
}

TEST(MatchLevels, DifferentSitesOrUnusableAddressesGiveZero) {
  EXPECT_EQ(match("https://www.example.com/a", "https://www.other.com/a"), kNoMatch);
  EXPECT_EQ(match(std::nullopt, "https://example.com/"), kNoMatch);
  EXPECT_EQ(match("https://example.com/", std::nullopt), kNoMatch);
  EXPECT_EQ(match("https://example.com/", "http://exa mple.com/"), kNoMatch);
  EXPECT_EQ(match("https://example.com/", "http://[::1"), kNoMatch);
}

TEST(MatchLevels, PrivateSuffixesCountAsSuffixes) {
  // Two blogs on one hosting suffix are different sites.
  EXPECT_EQ(match("https://alice.blogspot.com/post", "https://bob.blogspot.com/post"), kNoMatch);
  EXPECT_EQ(match("https://alice.blogspot.com/post", "https://www.alice.blogspot.com/post"), kSameAddress);
}

TEST(MatchLevels, IPAddressesAreNotReduced) {
  EXPECT_EQ(match("http://192.168.1.10/a", "https://192.168.1.10/a/"), kSameAddress);
  EXPECT_EQ(match("http://192.168.1.10/a", "http://10.168.1.10/a"), kNoMatch);
}

// Addresses embedded in AMP cache and viewer addresses.
TEST(EmbeddedAMP, CacheAddressMatchesTheShownPage) {
  EXPECT_EQ(match("https://www.example.com/path", "https://www-example-com.cdn.ampproject.org/c/s/www.example.com/path"),
            kSameAddress);
  EXPECT_EQ(match("https://www.example.com/path", "https://www-example-com.cdn.ampproject.org/v/s/example.com/path?x=1"),
            kIgnoringQuery);
}

TEST(EmbeddedAMP, ViewerAddressMatchesTheShownPage) {
  EXPECT_EQ(match("https://example.com/news/1", "https://www.google.com/amp/s/example.com/news/1"), kSameAddress);
  EXPECT_EQ(match("https://example.com/news/1", "https://www.google.co.uk/amp/s/www.example.com/news/1/"),
            kSameAddress);
}

TEST(EmbeddedAMP, DetectionRules) {
  auto embedded = [](std::string_view url) { return embeddedAMPURL(*parseURLComponents(url)); };
  EXPECT_EQ(embedded("https://a-b.cdn.ampproject.org/c/s/a.b/p/q?x#f"), "https://a.b/p/q?x#f");
  EXPECT_EQ(embedded("https://a-b.cdn.ampproject.org/c/a.b/p"), "http://a.b/p");
  EXPECT_EQ(embedded("https://www.google.com/amp/s/a.b/p"), "https://a.b/p");
  EXPECT_EQ(embedded("https://www.google.com/search?q=amp"), std::nullopt);
  EXPECT_EQ(embedded("https://www.notgoogle.com/amp/s/a.b/p"), std::nullopt);
  EXPECT_EQ(embedded("https://a-b.cdn.ampproject.org/x/s/a.b/p"), std::nullopt);
  EXPECT_EQ(embedded("https://a-b.cdn.ampproject.org/c/s/localhost/p"), std::nullopt);
  EXPECT_EQ(embedded("https://www.example.com/amp/s/a.b/p"), std::nullopt);
}

TEST(SiteString, IsTheRegistrableDomainWithoutItsSuffix) {
  auto site = [](std::string_view url) { return normalizedURLStringForTLDFeatures(*parseURLComponents(url)); };
  EXPECT_EQ(site("https://www.example.co.uk/a"), "example");
  EXPECT_EQ(site("https://example.com"), "example");
  EXPECT_EQ(site("http://localhost:8080/"), "localhost");
  EXPECT_EQ(site("http://10.0.0.1/"), "10.0.0.1");
  EXPECT_EQ(site("/relative/path"), std::nullopt);
  EXPECT_EQ(registrableDomain("a.b.example.com"), "example.com");
  EXPECT_EQ(registrableDomain("com"), std::nullopt);
}

// The filter over a session's feedback list.
class EngagedVisitFilter : public ::testing::Test {
 protected:
  using List = CBAFilterController::FeedbackList;
  static List listOf(std::initializer_list<corevireon::CVFeedbackPayload> payloads) {
    List list;
    for (const auto& p : payloads) *list.Add() = p;
    return list;
  }
  List run(List list) { return CBAFilterController().arrayOfCBAFilteredFeedback(std::move(list)); }
};

TEST_F(EngagedVisitFilter, MatchingVisitIsKeptWithItsLevelAndWithoutItsAddress) {
  auto out = run(listOf({visibleResults(7, {webResult("w", "https://www.example.com/a")}),
                         cba(7, "http://m.example.com/a/")}));
  ASSERT_EQ(out.size(), 2);
  ASSERT_TRUE(out[1].has_cbaengagement());
  EXPECT_EQ(out[1].cbaengagement().cbatype(), kSameAddress);
  EXPECT_FALSE(out[1].cbaengagement().has_url());
}

TEST_F(EngagedVisitFilter, BestLevelOverAllCandidatesOfTheQueryWins) {
  auto out = run(listOf({visibleResults(7, {webResult("a", "https://www.example.com/other")}),
                         visibleResults(7, {webResult("b", "https://www.example.com/a", "vireon.web_suggest")}),
                         cba(7, "https://example.com/a?q=1")}));
  ASSERT_EQ(out.size(), 3);
  EXPECT_EQ(out[2].cbaengagement().cbatype(), kIgnoringQuery);
}

TEST_F(EngagedVisitFilter, VisitBeforeTheResultsOfItsQueryIsDropped) {
  auto out = run(listOf({cba(7, "https://www.example.com/a"),
                         visibleResults(7, {webResult("w", "https://www.example.com/a")})}));
  ASSERT_EQ(out.size(), 1);
  EXPECT_TRUE(out[0].has_visibleresults());
}

TEST_F(EngagedVisitFilter, ResultsOfOtherSectionsOrQueriesAreNoCandidates) {
  auto out = run(listOf({visibleResults(7, {webResult("w", "https://www.example.com/a", "vireon.news")}),
                         visibleResults(8, {webResult("v", "https://www.example.com/a")}),
                         cba(7, "https://www.example.com/a")}));
  ASSERT_EQ(out.size(), 2);
  EXPECT_FALSE(out[0].has_cbaengagement() || out[1].has_cbaengagement());
}

TEST_F(EngagedVisitFilter, VisitWithoutAddressOrMatchingNothingIsDropped) {
  auto out = run(listOf({visibleResults(7, {webResult("w", "https://www.example.com/a")}), cba(7, std::nullopt),
                         cba(7, "https://www.unrelated.org/"), clearInput(5, 7)}));
  ASSERT_EQ(out.size(), 2);
  EXPECT_TRUE(out[0].has_visibleresults());
  EXPECT_TRUE(out[1].has_clearinput());
}

TEST_F(EngagedVisitFilter, ResultsWithoutPunchoutAddressesGiveNoCandidates) {
  auto noUrls = result("w", 1);
  noUrls.set_jsonsectionbundleidentifier("vireon.web_index");
  noUrls.mutable_punchout()->set_name("no addresses");
  auto out = run(listOf({visibleResults(7, {noUrls}), cba(7, "https://www.example.com/a")}));
  EXPECT_EQ(out.size(), 1);
}

TEST_F(EngagedVisitFilter, OtherPayloadsPassUnchangedInOrder) {
  auto out = run(listOf({messageless(9), clearInput(3), cba(1, "https://x.com/"), clearInput(4)}));
  ASSERT_EQ(out.size(), 3);
  EXPECT_EQ(out[0].type(), 9);
  EXPECT_EQ(out[1].clearinput().timestamp(), 3u);
  EXPECT_EQ(out[2].clearinput().timestamp(), 4u);
}

}  // namespace
}  // namespace fbf
