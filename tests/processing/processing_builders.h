// Small builders for the feedback messages the processing tests feed in.
#pragma once

#include "corevireon.pb.h"

#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>

namespace fbf::testing {

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

inline corevireon::CVFeedbackPayload visibleResults(uint64_t queryId,
                                                    std::initializer_list<corevireon::CVSearchResultForFeedback> rs,
                                                    uint64_t timestamp = 0) {
  corevireon::CVFeedbackPayload p;
  p.set_queryid(queryId);
  p.set_type(8);
  auto* m = p.mutable_visibleresults();
  m->set_timestamp(timestamp);
  for (const auto& r : rs) *m->add_results() = r;
  return p;
}

inline corevireon::CVFeedbackPayload cba(uint64_t queryId, std::optional<std::string> url, uint64_t timestamp = 0) {
  corevireon::CVFeedbackPayload p;
  p.set_queryid(queryId);
  p.set_type(40);
  auto* m = p.mutable_cbaengagement();
  m->set_timestamp(timestamp);
  if (url) m->set_url(*url);
  return p;
}

inline corevireon::CVFeedbackPayload clearInput(uint64_t timestamp, uint64_t queryId = 0) {
  corevireon::CVFeedbackPayload p;
  p.set_queryid(queryId);
  p.set_type(25);
  p.mutable_clearinput()->set_timestamp(timestamp);
  return p;
}

// A payload shaped by `build`, for the kinds without a builder of their own.
template <typename Build>
corevireon::CVFeedbackPayload payloadWith(Build build) {
  corevireon::CVFeedbackPayload p;
  build(p);
  return p;
}

inline corevireon::CVFeedbackPayload messageless(int32_t type) {
  corevireon::CVFeedbackPayload p;
  p.set_type(type);
  return p;
}

}  // namespace fbf::testing
