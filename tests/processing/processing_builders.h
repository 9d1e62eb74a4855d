// Small builders for the feedback messages the processing tests feed in.
#pragma once

#include "corevireon.pb.h"

#include <google/protobuf/text_format.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>

namespace fbf::testing {

// A message from its text form, e.g. pb(R"(visibleResults { results { identifier: "r" } })").
template <typename T = corevireon::CVFeedbackPayload>
T pb(const std::string& text) {
  T m;
  EXPECT_TRUE(google::protobuf::TextFormat::ParseFromString(text, &m)) << text;
  return m;
}

inline corevireon::CVSearchResultForFeedback result(const std::string& id, int32_t type = 2) {
  return pb<corevireon::CVSearchResultForFeedback>("identifier: \"" + id + "\" type: " + std::to_string(type));
}

inline corevireon::CVSearchResultForFeedback webResult(const std::string& id, const std::string& url,
                                                       const std::string& section = "vireon.web_index") {
  auto r = result(id, 1);
  r.set_jsonsectionbundleidentifier(section);
  r.mutable_punchout()->mutable_urls()->add_items(url);
  return r;
}

inline corevireon::CVFeedbackPayload visibleResults(
    uint64_t queryId, std::initializer_list<corevireon::CVSearchResultForFeedback> rs, uint64_t timestamp = 0) {
  auto p = pb("type: 8 queryId: " + std::to_string(queryId) + " visibleResults { timestamp: " + std::to_string(timestamp) + " }");
  for (const auto& r : rs) *p.mutable_visibleresults()->add_results() = r;
  return p;
}

inline corevireon::CVFeedbackPayload cba(uint64_t queryId, std::optional<std::string> url) {
  auto p = pb("type: 40 queryId: " + std::to_string(queryId) + " cbaEngagement { }");
  if (url) p.mutable_cbaengagement()->set_url(*url);
  return p;
}

inline corevireon::CVFeedbackPayload clearInput(uint64_t timestamp, uint64_t queryId = 0) {
  return pb("type: 25 queryId: " + std::to_string(queryId) + " clearInput { timestamp: " + std::to_string(timestamp) + " }");
}

inline corevireon::CVFeedbackPayload messageless(int32_t type) { return pb("type: " + std::to_string(type)); }

}  // namespace fbf::testing
