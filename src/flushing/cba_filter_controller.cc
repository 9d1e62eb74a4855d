#include "flushing/cba_filter_controller.h"

#include "flushing/url_matching.h"

#include <algorithm>
#include <optional>
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
  // Views into the shown results' addresses, which stay where they are while
  // the list is filtered (elements are only swapped, and removed at the end).
  std::unordered_map<uint64_t, std::set<std::string_view>> candidatesByQuery;
  // Each shown address is parsed once, however many visits it is compared
  // with; parsing dominated the filter when it was done per comparison.
  std::unordered_map<std::string_view, std::optional<CBAComparable>> comparable;
  auto comparableCandidate = [&](std::string_view url) -> const std::optional<CBAComparable>& {
    auto [it, added] = comparable.try_emplace(url);
    if (added) it->second = cbaComparable(url);
    return it->second;
  };
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
      std::optional<CBAComparable> visited;
      if (cba->has_url()) visited = cbaComparable(cba->url());
      cba->clear_url();
      auto it = candidatesByQuery.find(payload.queryid());
      if (visited && it != candidatesByQuery.end() && !it->second.empty()) {
        int best = corevireon::CV_CBA_ENGAGEMENT_TYPE_NO_MATCH;
        for (std::string_view candidate : it->second) {
          const auto& shown = comparableCandidate(candidate);
          if (!shown) continue;
          best = std::max<int>(best, cbaMatchBetween(*shown, *visited));
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
