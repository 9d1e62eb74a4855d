// Helpers for the flushing tests: session names with predictable UUIDs and a
// cache directory populated file by file.
#pragma once

#include "flushing/session_filename.h"
#include "platform/file_manager.h"

#include <string>
#include <string_view>
#include <vector>

namespace fbf::testing {

// A canonical UUID whose first group is `n`, so names sort in `n` order.
std::string uuidString(unsigned n);
// session.<pid>.<uuidString(n)>.<state>
std::string sessionName(SessionFileState state, unsigned n, int pid = 12);
// Writes `contents` to dir/name and returns the path.
fs::path makeFile(const fs::path& dir, std::string_view name, std::string_view contents = "x");
SystemTime creationDate(const FileManager& fm, const fs::path& path);
// Like makeFile, recreating the file until its creation date is later than
// that of `earlier` (creation times are coarse, so two files made in a row
// often share one).
fs::path makeFileCreatedAfter(const FileManager& fm, const fs::path& earlier, const fs::path& dir,
                              std::string_view name);
// Names of every entry directly in `dir` (any kind), sorted.
std::vector<std::string> entryNames(const fs::path& dir);

}  // namespace fbf::testing
