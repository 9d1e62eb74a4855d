// Where the search daemon's shared cache lives. Pure path computations over
// the file manager; nothing here creates anything.
#pragma once

#include "platform/file_manager.h"

#include <optional>

namespace fbf {

// <caches>/vireond, when the caches directory exists.
std::optional<fs::path> cacheDirNoCreate(const FileManager& fm);
std::optional<fs::path> cachedBagURL(const FileManager& fm);
std::optional<fs::path> customFeedbackDir(const FileManager& fm);
std::optional<fs::path> databaseURL(const FileManager& fm);

}  // namespace fbf
