#include "assembly/feedback_types.h"

#include <strings.h>

#include <array>

namespace fbf {
namespace {

constexpr std::array<std::string_view, 15> kNames = {
    "unknown",         "WayfinAutoFill",           "Crowdsourcing",         "ScoutlumeResultFeatures",
    "WayfinAutoPlay",  "Quenbury",                 "EngagedCompletionFeatures", "ForesightEventTracker",
    "Pelorus",         "TandemExpert",             "UserReport",            "Usage",
    "FeedbackV2",      "FeedbackV2PB",             "last_",
};

}  // namespace

std::string knownFeedbackTypeName(int code) {
  if (code >= 0 && code < static_cast<int>(kNames.size())) return std::string(kNames[code]);
  return "(unknown: " + std::to_string(code) + ")";
}

std::optional<int> knownFeedbackTypeFromName(std::string_view name, bool caseInsensitive) {
  for (int code = 1; code < kKnownFeedbackTypeLast; ++code) {
    auto n = kNames[code];
    bool eq = caseInsensitive ? (n.size() == name.size() && strncasecmp(n.data(), name.data(), n.size()) == 0)
                              : n == name;
    if (eq) return code;
  }
  return std::nullopt;
}

const std::vector<std::string>& allCustomFeedbackDirectories() {
  static const std::vector<std::string> dirs = {
      "Crowdsourcing", "ScoutlumeResultFeatures", "WayfinAutoPlay", "EngagedCompletionFeatures",
      "ForesightEventTracker", "Pelorus", "UserReport", "FeedbackV2PB", "WayfinAutoFill",
      "Quenbury", "TandemExpert", "Usage", "FeedbackV2",
  };
  return dirs;
}

}  // namespace fbf
