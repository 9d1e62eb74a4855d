// The harnesses' assertion: an invariant that fails is a finding, so it
// aborts with the broken rule (libFuzzer then saves the input).
#pragma once

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <vector>

namespace fs = std::filesystem;

#define FUZZ_CHECK(condition, ...)                                                 \
  do {                                                                             \
    if (!(condition)) {                                                            \
      std::fprintf(stderr, "%s:%d: invariant broken: %s\n", __FILE__, __LINE__, #condition); \
      std::fprintf(stderr, "  " __VA_ARGS__);                                      \
      std::fprintf(stderr, "\n");                                                  \
      std::abort();                                                                \
    }                                                                              \
  } while (0)

namespace fbf::fuzz {

// libFuzzer never tears a harness's fixture down: its throw-away home is
// removed when the process exits instead.
inline void removeAtExit(const std::filesystem::path& dir) {
  static std::vector<std::filesystem::path> dirs;
  if (dirs.empty()) {
    std::atexit([] {
      for (const auto& d : dirs) {
        std::error_code ec;
        std::filesystem::remove_all(d, ec);
      }
    });
  }
  dirs.push_back(dir);
}

}  // namespace fbf::fuzz
