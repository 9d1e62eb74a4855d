// Shared by the flushing tests: session names with predictable UUIDs, a cache
// directory populated file by file, and a fixture holding a temporary home.
#pragma once

#include "flushing/cache_layout.h"
#include "flushing/feedback_enumerator.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

namespace fbf::testing {

using S = SessionFileState;

// session.<pid>.<UUID>.<state>, the UUID's first group being `n`, so names sort in `n` order.
inline std::string sessionName(S state, unsigned n) {
  char uuid[40];
  std::snprintf(uuid, sizeof uuid, "%08X-0000-4000-8000-00000000ABCD", n);
  return "session.12." + std::string(uuid) + "." + std::string(toString(state));
}
inline fs::path makeFile(const fs::path& dir, std::string_view name, std::string_view bytes = "x") {
  writeFile(dir / std::string(name), bytes);
  return dir / std::string(name);
}
inline SystemTime creationDate(const FileManager& fm, const fs::path& path) {
  return fm.attributes(path).value().creationDate;
}
// Like makeFile, recreating the file until it is created later than `earlier`
// (creation times are coarse, so two files made in a row often share one).
inline fs::path makeFileCreatedAfter(const FileManager& fm, const fs::path& earlier,
                                     const fs::path& dir, std::string_view name) {
  while (creationDate(fm, makeFile(dir, name)) <= creationDate(fm, earlier)) {
    fs::remove(dir / std::string(name));
  }
  return dir / std::string(name);
}
// Names of every entry directly in `dir`, sorted.
inline std::vector<std::string> entryNames(const fs::path& dir) {
  std::vector<std::string> names;
  for (const auto& e : fs::directory_iterator(dir)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}
inline std::vector<FeedbackFile> drain(std::optional<FeedbackEnumerator> e) {
  std::vector<FeedbackFile> out;
  for (std::optional<FeedbackFile> f; e && (f = e->next());) out.push_back(std::move(*f));
  return out;
}

class CacheTest : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  fs::path cache() const { return env.cacheDir(); }
  fs::path session(S state, unsigned n, std::string_view suffix = "") {
    return makeFile(cache(), sessionName(state, n) + std::string(suffix));
  }

  TestEnvironment env;
  LogCapture logs;
};

}  // namespace fbf::testing
