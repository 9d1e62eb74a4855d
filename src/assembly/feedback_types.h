// Codes of the known feedback types and the names they are rendered by (in
// log lines, upload type strings, custom feedback directory names and
// deletion events).
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

inline constexpr int kKnownFeedbackTypeUnknown = 0;
inline constexpr int kKnownFeedbackTypeLast = 14;

// "unknown" for 0, "last_" for the end marker 14, "(unknown: N)" otherwise.
std::string knownFeedbackTypeName(int code);
// The code of a rendered name (1..13). Case-insensitive when asked.
std::optional<int> knownFeedbackTypeFromName(std::string_view name, bool caseInsensitive = false);
// The custom feedback type names, each also its directory name.
const std::vector<std::string>& allCustomFeedbackDirectories();

}  // namespace fbf
