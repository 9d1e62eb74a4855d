#include "flushing/cba_filter_controller.h"

#include "flushing/url_matching.h"

#include <algorithm>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>

namespace fbf {

namespace {

constexpr std::string_view kWebIndexSection = "vireon.web_index";
constexpr std::string_view kWebSuggestSection = "vireon.web_suggest";

bool isWebSection(const corevireon::CVSearchResultForFeedback& result) {
  return result.has_jsonsectionbundleidentifier() &&
         (result.jsonsectionbundleidentifier() == kWebIndexSection ||
          result.jsonsectionbundleidentifier() == kWebSuggestSection);
}

}  // namespace

CBAFilterController::FeedbackList CBAFilterController::arrayOfCBAFilteredFeedback(FeedbackList feedback) const {
  filter(feedback);
  return feedback;
}

void CBAFilterController::filter(FeedbackList& feedback) const {
  std::unordered_map<uint64_t, std::set<std::string>> candidatesByQuery;
  int kept = 0;
  for (int i = 0; i < feedback.size(); ++i) {
    corevireon::CVFeedbackPayload& payload = *feedback.Mutable(i);
    bool keep = true;
    if (payload.has_visibleresults()) {
      auto& candidates = candidatesByQuery[payload.queryid()];
      for (const auto& result : payload.visibleresults().results()) {
        if (!isWebSection(result) || !result.has_punchout() || !result.punchout().has_urls()) continue;
        for (const auto& url : result.punchout().urls().items()) candidates.insert(url);
      }
    } else if (payload.has_cbaengagement()) {
      auto* cba = payload.mutable_cbaengagement();
      cba->set_cbatype(corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH);
      std::optional<std::string> visited;
      if (cba->has_url()) visited = cba->url();
      cba->clear_url();
      auto it = candidatesByQuery.find(payload.queryid());
      if (it != candidatesByQuery.end() && !it->second.empty()) {
        int best = corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
        for (const std::string& candidate : it->second) {
          std::optional<std::string_view> v;
          if (visited) v = *visited;
          best = std::max<int>(best, cbaMatchBetween(candidate, v));
          if (best == corevireon::CV_CBA_ENGAGEMENT_TYPE_SAME_ADDRESS) break;
        }
        cba->set_cbatype(static_cast<corevireon::CVCBAEngagementType>(best));
      }
      keep = cba->cbatype() != corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
    }
    if (keep) {
      if (kept != i) feedback.SwapElements(kept, i);
      ++kept;
    }
  }
  feedback.DeleteSubrange(kept, feedback.size() - kept);
}

}  // namespace fbf
