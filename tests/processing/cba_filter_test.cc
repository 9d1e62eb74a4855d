#include "flushing/cba_filter_controller.h"
#include "flushing/url_matching.h"
#include "processing/processing_builders.h"

namespace fbf::testing {
namespace {

using std::nullopt;

// Guards against: a wrong match level between a shown address and a visited one (suffixes, AMP, queries, IPs).
TEST(MatchLevels, BetweenShownAndVisitedAddresses) {
  struct Row {
    std::optional<std::string_view> shown, visited;
    int level;  // 0 no match, 1 same site, 2 same address ignoring the query, 3 same address
  };
  const Row rows[] = {
      {"https://www.example.com/recipes/pasta", "http://m.example.com/recipes/pasta/", 3},
      {"https://example.com", "https://example.com/", 3}, {"https://WWW.Example.COM/a", "https://example.com/a", 3},
      {"https://news.bbc.co.uk/x", "https://www.bbc.co.uk/x", 3},
      {"https://www.example.com/a", "https://example.com/a?utm_source=x", 2},
      {"https://example.com/a?id=1", "https://example.com/a?id=2", 2},
      {"https://www.example.com/a", "https://example.com/b", 1},
      {"https://www.example.com/a", "https://shop.example.co.uk/", 1},
      {"https://www.example.com/a#top", "https://example.com/a#bottom", 1},
      {"https://www.example.com/a", "https://www.other.com/a", 0}, {nullopt, "https://example.com/", 0},
      {"https://example.com/", nullopt, 0}, {"https://example.com/", "http://exa mple.com/", 0},
      {"https://example.com/", "http://[::1", 0},
      {"https://alice.blogspot.com/post", "https://bob.blogspot.com/post", 0},  // private suffixes are suffixes
      {"https://alice.blogspot.com/post", "https://www.alice.blogspot.com/post", 3},
      {"http://192.168.1.10/a", "https://192.168.1.10/a/", 3},
      {"http://192.168.1.10/a", "http://10.168.1.10/a", 0},  // addresses are not reduced to a site
      {"https://www.example.com/path", "https://www-example-com.cdn.ampproject.org/c/s/www.example.com/path", 3},
      {"https://www.example.com/path", "https://www-example-com.cdn.ampproject.org/v/s/example.com/path?x=1", 2},
      {"https://example.com/news/1", "https://www.google.com/amp/s/example.com/news/1", 3},
      {"https://example.com/news/1", "https://www.google.co.uk/amp/s/www.example.com/news/1/", 3},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(cbaMatchBetween(row.shown, row.visited), row.level)
        << row.shown.value_or("<none>") << " vs " << row.visited.value_or("<none>");
  }
}

// Guards against: an embedded AMP address found where there is none, or built with the wrong scheme or path.
TEST(MatchLevels, EmbeddedAddressesAndSiteNames) {
  const std::pair<std::string_view, std::optional<std::string>> embedded[] = {
      {"https://a-b.cdn.ampproject.org/c/s/a.b/p/q?x#f", "https://a.b/p/q?x#f"},
      {"https://a-b.cdn.ampproject.org/c/a.b/p", "http://a.b/p"},
      {"https://www.google.com/amp/s/a.b/p", "https://a.b/p"}, {"https://www.google.com/search?q=amp", nullopt},
      {"https://www.notgoogle.com/amp/s/a.b/p", nullopt}, {"https://a-b.cdn.ampproject.org/x/s/a.b/p", nullopt},
      {"https://a-b.cdn.ampproject.org/c/s/localhost/p", nullopt}, {"https://www.example.com/amp/s/a.b/p", nullopt},
  };
  for (const auto& [url, expected] : embedded) EXPECT_EQ(embeddedAMPURL(*parseURLComponents(url)), expected) << url;
  EXPECT_EQ(normalizedURLStringForTLDFeatures(*parseURLComponents("https://www.example.co.uk/a")), "example");
  EXPECT_EQ(normalizedURLStringForTLDFeatures(*parseURLComponents("/relative/path")), nullopt);
}

// Guards against: a visit kept without a matching earlier result of its query, or kept with its address.
TEST(EngagedVisitFilter, KeepsMatchedVisitsWithTheirBestLevelAndNoAddress) {
  const std::string a = "https://www.example.com/a";
  auto noUrls = result("w", 1);
  noUrls.set_jsonsectionbundleidentifier("vireon.web_index");
  noUrls.mutable_punchout()->set_name("no addresses");
  struct Row {
    const char* name;
    std::vector<corevireon::CVFeedbackPayload> list;
    std::string kept;  // V visible results, C<level> visit (u: with address), I<time> clear input, T<type>
  };
  const Row rows[] = {
      {"matching visit", {visibleResults(7, {webResult("w", a)}), cba(7, "http://m.example.com/a/")}, "V C3"},
      {"best level over all candidates of the query",
       {visibleResults(7, {webResult("a", "https://www.example.com/other")}),
        visibleResults(7, {webResult("b", a, "vireon.web_suggest")}), cba(7, "https://example.com/a?q=1")},
       "V V C2"},
      {"visit before the results of its query", {cba(7, a), visibleResults(7, {webResult("w", a)})}, "V"},
      {"results of other sections or queries",
       {visibleResults(7, {webResult("w", a, "vireon.news")}), visibleResults(8, {webResult("v", a)}), cba(7, a)},
       "V V"},
      {"visit without address or matching nothing",
       {visibleResults(7, {webResult("w", a)}), cba(7, nullopt), cba(7, "https://www.unrelated.org/"),
        clearInput(5, 7)},
       "V I5"},
      {"results without punch-out addresses", {visibleResults(7, {noUrls}), cba(7, a)}, "V"},
      {"other payloads pass in order", {messageless(9), clearInput(3), cba(1, "https://x.com/"), clearInput(4)},
       "T9 I3 I4"},
  };
  for (const auto& row : rows) {
    CBAFilterController::FeedbackList list;
    for (const auto& p : row.list) *list.Add() = p;
    std::string kept;
    for (const auto& p : CBAFilterController().arrayOfCBAFilteredFeedback(std::move(list))) {
      const auto& v = p.cbaengagement();
      kept += std::string(kept.empty() ? "" : " ") +
              (p.has_visibleresults() ? "V"
               : p.has_cbaengagement() ? "C" + std::to_string(v.cbatype()) + (v.has_url() ? "u" : "")
               : p.has_clearinput()    ? "I" + std::to_string(p.clearinput().timestamp())
                                       : "T" + std::to_string(p.type()));
    }
    EXPECT_EQ(kept, row.kept) << row.name;
  }
}

}  // namespace
}  // namespace fbf::testing
