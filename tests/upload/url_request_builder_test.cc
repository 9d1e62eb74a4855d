#include "upload/url_request_builder.h"

#include "support/test_support.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

// Guards against: a request URL whose query is unsorted, misencoded or wrongly merged.
TEST(RequestBuilderQuery, EndpointDefaultsAndForcedItemsMergeIntoOneSortedQuery) {
  struct Row {
    const char* name;
    const char* endpoint;
    std::vector<QueryItem> defaults, forces;
    const char* url;
  };
  const Row rows[] = {
      {"the endpoint's item beats a default", "https://h.example/u?v=9", {{"v", "2"}}, {},
       "https://h.example/u?v=9"},
      {"a forced item beats the endpoint's", "https://h.example/u?v=9", {{"v", "2"}}, {{"v", "3"}},
       "https://h.example/u?v=3"},
      {"later items of one name win", "https://h.example/u?a=1&b&a=2&&c=%41", {}, {},
       "https://h.example/u?a=2&b&c=A"},
      {"all but unreserved characters encoded", "https://h.example/p", {},
       {{"q", "a&b=c d+e/f?g~h-i_j.k"}, {"n\xC3\xA9", "\xE2\x82\xAC"}},
       "https://h.example/p?n%C3%A9=%E2%82%AC&q=a%26b%3Dc%20d%2Be%2Ff%3Fg~h-i_j.k"},
      {"an item without value is its bare name", "https://h.example/p", {},
       {{"x", "1"}, {"flag", std::nullopt}}, "https://h.example/p?flag&x=1"},
      {"everything but the query is kept", "https://user@h.example:8443/a/b?old=1#frag", {},
       {{"new", "2"}}, "https://user@h.example:8443/a/b?new=2&old=1#frag"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    VireonURLRequestBuilder builder(row.endpoint);
    for (const auto& i : row.defaults) builder.defaultQueryItemWithName(i.name, i.value);
    for (const auto& i : row.forces) builder.forceQueryItemWithName(i.name, i.value);
    EXPECT_EQ(builder.createUrlRequest().url, row.url);
  }
  std::vector<QueryItem> notText = {{"bad\xFF", "1"}, {"ok", "bad\xC3"}, {"z", "2"}};
  EXPECT_EQ(VireonURLRequestBuilder::encodeQueryItems(notText), "ok&z=2");
}

// Guards against: a request built for a non-http(s) or unparseable endpoint.
TEST(RequestBuilderOnABadEndpoint, LogsAndThrowsOrStops) {
  for (const char* url : {"ftp://h.example/p", "h.example/p", "/a/path", "HTTPS://h.example/p"}) {
    testing::LogCapture logs;
    VireonURLRequestBuilder builder(url);
    EXPECT_THROW(builder.createUrlRequest(), VireonURLRequestBuilder::URLError) << url;
    EXPECT_TRUE(logs.contains("Scheme for url is neither http nor https.")) << url;
  }
  EXPECT_FALSE(URLComponents::parse("http://[::1"));
  // Digits, "+", "-" and "." may follow the scheme's first letter.
  auto other = URLComponents::parse("web+x-1.2://h.example/p");
  ASSERT_TRUE(other);
  EXPECT_EQ(other->scheme, "web+x-1.2");
  EXPECT_EQ(other->authority, "h.example");
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VireonURLRequestBuilder("https://h.example/a b"), "cannot be parsed");
}

}  // namespace
}  // namespace fbf
