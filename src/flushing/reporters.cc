#include "flushing/reporters.h"

#include "flushing/feedback_capabilities.h"
#include "flushing/message_cast.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <string>
#include <utility>

namespace fbf {

using corevireon::CVClient;

namespace {

constexpr int32_t kDestinationNotCounted = 1;
constexpr int32_t kEndpointWithoutKeystroke = 12;

}  // namespace

CVClient cohortsClient(std::optional<std::string_view> agent) {
  if (!agent || agent->empty()) return corevireon::CV_CLIENT_NONE;
  std::string lower(*agent);
  std::transform(lower.begin(), lower.end(), lower.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  static constexpr std::array<std::pair<std::string_view, CVClient>, 4> kRules = {{
      {"wayfin", corevireon::CV_CLIENT_WEB_BROWSER},
      {"scoutlume", corevireon::CV_CLIENT_SYSTEM_SEARCH_UI},
      {"news", corevireon::CV_CLIENT_NEWS},
      {"messages", corevireon::CV_CLIENT_MESSAGING},
  }};
  for (const auto& [needle, client] : kRules) {
    if (lower.find(needle) != std::string::npos) return client;
  }
  return corevireon::CV_CLIENT_NONE;
}

CVClient cohortsClient(const corevireon::CVClientSession& session) {
  if (!session.has_agent()) return corevireon::CV_CLIENT_NONE;
  return cohortsClient(std::string_view(session.agent()));
}

const std::set<int32_t>& triggerEventScoutlumePreviewTypes() {
  static const std::set<int32_t> types = {
      corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_SPACE_KEY,
      corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_HOVER,
      corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_PREVIEW_PRESS,
  };
  return types;
}

std::optional<EngagementReporter> EngagementReporter::from(const google::protobuf::Message& feedback) {
  if (auto* m = messageAs<corevireon::CVResultEngagementFeedback>(feedback)) return EngagementReporter(m);
  if (auto* m = messageAs<corevireon::CVDidGoToSiteFeedback>(feedback)) return EngagementReporter(m);
  if (auto* m = messageAs<corevireon::CVDidGoToSearchFeedback>(feedback)) return EngagementReporter(m);
  return std::nullopt;
}

bool EngagementReporter::isEngagement(CVClient client) const {
  if (auto* const* p = std::get_if<const corevireon::CVResultEngagementFeedback*>(&feedback_)) {
    const auto* m = *p;
    if (client != corevireon::CV_CLIENT_SYSTEM_SEARCH_UI) return true;
    return triggerEventScoutlumePreviewTypes().count(m->triggerevent()) == 0 &&
           m->destination() != kDestinationNotCounted;
  }
  if (std::holds_alternative<const corevireon::CVDidGoToSiteFeedback*>(feedback_)) {
    return client == corevireon::CV_CLIENT_WEB_BROWSER;
  }
  return client == corevireon::CV_CLIENT_WEB_BROWSER || client == corevireon::CV_CLIENT_SYSTEM_SEARCH_UI;
}

const corevireon::CVResultEngagementFeedback* EngagementReporter::resultEngagement() const {
  auto* const* m = std::get_if<const corevireon::CVResultEngagementFeedback*>(&feedback_);
  return m ? *m : nullptr;
}

std::optional<KeystrokeReporter> KeystrokeReporter::from(const google::protobuf::Message& feedback) {
  if (auto* m = messageAs<corevireon::CVStartLocalSearchFeedback>(feedback)) return KeystrokeReporter(m);
  if (auto* m = messageAs<corevireon::CVStartNetworkSearchFeedback>(feedback)) return KeystrokeReporter(m);
  return std::nullopt;
}

bool KeystrokeReporter::isKeystroke() const {
  if (auto* const* m = std::get_if<const corevireon::CVStartLocalSearchFeedback*>(&feedback_)) {
    return (*m)->has_input() && !(*m)->input().empty();
  }
  const auto& m = *std::get<const corevireon::CVStartNetworkSearchFeedback*>(feedback_);
  if (m.endpoint() == kEndpointWithoutKeystroke) return false;
  return m.has_input() && !m.input().empty();
}

std::optional<RankingReporter> RankingReporter::from(const google::protobuf::Message& feedback) {
  if (auto* m = messageAs<corevireon::CVRankingFeedback>(feedback)) return RankingReporter(*m);
  return std::nullopt;
}

std::vector<const corevireon::CVSearchResultForFeedback*> RankingReporter::containedResults() const {
  return fbf::containedResults(*feedback_);
}

}  // namespace fbf
