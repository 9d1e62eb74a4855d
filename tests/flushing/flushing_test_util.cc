#include "flushing/flushing_test_util.h"

#include "support/test_support.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>

namespace fbf::testing {

std::string uuidString(unsigned n) {
  char buf[40];
  std::snprintf(buf, sizeof buf, "%08X-0000-4000-8000-00000000ABCD", n);
  return buf;
}

std::string sessionName(SessionFileState state, unsigned n, int pid) {
  return "session." + std::to_string(pid) + "." + uuidString(n) + "." +
         std::string(toString(state));
}

fs::path makeFile(const fs::path& dir, std::string_view name, std::string_view contents) {
  fs::path path = dir / std::string(name);
  writeFile(path, contents);
  return path;
}

SystemTime creationDate(const FileManager& fm, const fs::path& path) {
  auto attrs = fm.attributes(path);
  if (!attrs) std::abort();
  return attrs->creationDate;
}

fs::path makeFileCreatedAfter(const FileManager& fm, const fs::path& earlier, const fs::path& dir,
                              std::string_view name) {
  SystemTime before = creationDate(fm, earlier);
  while (true) {
    fs::path path = makeFile(dir, name);
    if (creationDate(fm, path) > before) return path;
    fs::remove(path);
  }
}

std::vector<std::string> entryNames(const fs::path& dir) {
  std::vector<std::string> names;
  for (const auto& e : fs::directory_iterator(dir)) names.push_back(e.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

}  // namespace fbf::testing
