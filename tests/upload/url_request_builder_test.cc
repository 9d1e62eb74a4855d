#include "upload/url_request_builder.h"

#include "support/test_support.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

std::string queryOf(const HttpRequest& r) {
  auto q = r.url.find('?');
  return q == std::string::npos ? std::string() : r.url.substr(q + 1);
}

TEST(BuilderOnAnEndpointWithAQuery, KeepsTheEndpointsItemsAgainstDefaults) {
  VireonURLRequestBuilder builder("https://feedback.example.net/upload?v=9");
  builder.defaultQueryItemWithName("v", "2");
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "v=9");
  builder.forceQueryItemWithName("v", "3");
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "v=3");
}

TEST(BuilderOnAnEndpointWithAQuery, LaterItemsOfTheSameNameWin) {
  VireonURLRequestBuilder builder("https://feedback.example.net/upload?a=1&b&a=2&&c=%41");
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "a=2&b&c=A");
}

TEST(BuilderQueryString, IsSortedByNameNotByInsertion) {
  VireonURLRequestBuilder builder("https://h.example/p");
  builder.defaultQueryItemWithName("type", "FeedbackV2PB");
  builder.defaultQueryItemWithName("key", "k");
  builder.defaultQueryItemWithName("v", "2");
  auto request = builder.createUrlRequest();
  EXPECT_EQ(request.url, "https://h.example/p?key=k&type=FeedbackV2PB&v=2");

  VireonURLRequestBuilder other("https://h.example/p");
  other.defaultQueryItemWithName("v", "2");
  other.defaultQueryItemWithName("type", "FeedbackV2PB");
  other.defaultQueryItemWithName("key", "k");
  EXPECT_EQ(other.createUrlRequest().url, request.url);
}

TEST(BuilderQueryString, PercentEncodesEverythingButUnreservedCharacters) {
  VireonURLRequestBuilder builder("https://h.example/p");
  builder.forceQueryItemWithName("q", "a&b=c d+e/f?g~h-i_j.k");
  builder.forceQueryItemWithName("n\xC3\xA9", "\xE2\x82\xAC");
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "n%C3%A9=%E2%82%AC&q=a%26b%3Dc%20d%2Be%2Ff%3Fg~h-i_j.k");
}

TEST(BuilderQueryString, WritesAnItemWithoutValueAsItsBareName) {
  VireonURLRequestBuilder builder("https://h.example/p");
  builder.forceQueryItemWithName("flag", std::nullopt);
  builder.forceQueryItemWithName("x", "1");
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "flag&x=1");
}

TEST(BuilderQueryString, DropsNamesAndValuesThatAreNotText) {
  std::vector<QueryItem> items = {{"bad\xFF", "1"}, {"ok", "bad\xC3"}, {"z", "2"}};
  EXPECT_EQ(VireonURLRequestBuilder::encodeQueryItems(items), "ok&z=2");
}

TEST(BuilderDefaultsAndForces, FollowTheirSemanticsForItemsAndHeaders) {
  VireonURLRequestBuilder builder("http://h.example/p");
  EXPECT_FALSE(builder.containsQueryItem("a"));
  builder.defaultQueryItem({"a", "1"});
  builder.defaultQueryItem({"a", "2"});
  EXPECT_TRUE(builder.containsQueryItem("a"));
  builder.forceQueryItemsFrom(std::vector<QueryItem>{{"b", "1"}, {"a", "3"}});
  builder.forceQueryItemsFrom(std::nullopt);
  EXPECT_EQ(queryOf(builder.createUrlRequest()), "a=3&b=1");

  builder.defaultHttpHeader("User-Agent", "one");
  builder.defaultHttpHeader("User-Agent", "two");
  EXPECT_TRUE(builder.containsHttpHeader("User-Agent", "one"));
  EXPECT_FALSE(builder.containsHttpHeader("User-Agent", "two"));
  builder.forceHttpHeader("User-Agent", "three");
  EXPECT_TRUE(builder.containsHttpHeader("User-Agent", "three"));
  EXPECT_FALSE(builder.containsHttpHeader("Accept"));
  auto request = builder.createUrlRequest();
  EXPECT_EQ(request.header("user-agent"), "three");
  EXPECT_EQ(request.timeout, std::chrono::seconds(60));
  EXPECT_FALSE(request.ignoreLocalCache);
}

TEST(BuilderOnAnEndpointWithFragmentAndPort, KeepsEverythingButTheQuery) {
  VireonURLRequestBuilder builder("https://user@h.example:8443/a/b?old=1#frag");
  builder.forceQueryItemWithName("new", "2");
  EXPECT_EQ(builder.createUrlRequest().url, "https://user@h.example:8443/a/b?new=2&old=1#frag");
}

TEST(BuilderOnANonHttpScheme, LogsAndThrows) {
  for (const char* url : {"ftp://h.example/p", "h.example/p", "/just/a/path", "HTTPS://h.example/p"}) {
    testing::LogCapture logs;
    VireonURLRequestBuilder builder(url);
    EXPECT_THROW(builder.createUrlRequest(), VireonURLRequestBuilder::URLError) << url;
    EXPECT_TRUE(logs.contains("Scheme for url is neither http nor https.")) << url;
  }
}

TEST(BuilderOnAnUnparseableURL, StopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VireonURLRequestBuilder("https://h.example/a b"), "cannot be parsed");
  EXPECT_FALSE(URLComponents::parse("http://[::1"));
}

}  // namespace
}  // namespace fbf
