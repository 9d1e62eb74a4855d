// The harnesses' assertion: an invariant that fails is a finding, so it
// aborts with the broken rule (libFuzzer then saves the input).
#pragma once

#include <cstdio>
#include <cstdlib>
#include <filesystem>

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
