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

// A payload shaped by `build`, for the kinds without a builder of their own.
template <typename Build>
corevireon::CVFeedbackPayload payloadWith(Build build, uint64_t queryId = 0, int32_t type = 0) {
  corevireon::CVFeedbackPayload p;
  p.set_queryid(queryId);
  p.set_type(type);
  build(p);
  return p;
}

inline corevireon::CVSearchResultForFeedback result(const std::string& id, int32_t type = 2) {
  corevireon::CVSearchResultForFeedback r;
  r.set_identifier(id);
  r.set_type(type);
  return r;
}

inline corevireon::CVSearchResultForFeedback webResult(const std::string& id, const std::string& url,
                                                       const std::string& section = "vireon.web_index") {
  auto r = result(id, 1);
  r.set_jsonsectionbundleidentifier(section);
  r.mutable_punchout()->mutable_urls()->add_items(url);
  return r;
}

inline corevireon::CVSearchSuggestionForFeedback suggestion(const std::string& id, int32_t type = 1) {
  corevireon::CVSearchSuggestionForFeedback s;
  s.set_identifier(id);
  s.set_type(type);
  return s;
}

inline corevireon::CVFeedbackPayload visibleResults(
    uint64_t queryId, std::initializer_list<corevireon::CVSearchResultForFeedback> rs, uint64_t timestamp = 0) {
  return payloadWith([&](auto& p) {
    p.mutable_visibleresults()->set_timestamp(timestamp);
    for (const auto& r : rs) *p.mutable_visibleresults()->add_results() = r;
  }, queryId, 8);
}

inline corevireon::CVFeedbackPayload cba(uint64_t queryId, std::optional<std::string> url) {
  return payloadWith([&](auto& p) {
    p.mutable_cbaengagement()->set_timestamp(0);
    if (url) p.mutable_cbaengagement()->set_url(*url);
  }, queryId, 40);
}

inline corevireon::CVFeedbackPayload clearInput(uint64_t timestamp, uint64_t queryId = 0) {
  return payloadWith([&](auto& p) { p.mutable_clearinput()->set_timestamp(timestamp); }, queryId, 25);
}

inline corevireon::CVFeedbackPayload messageless(int32_t type) {
  return payloadWith([](auto&) {}, 0, type);
}

}  // namespace fbf::testing
