// The fixture the flushing tests share: a temporary home with its cache
// directory, the log lines written meanwhile, and walks drained into vectors.
#pragma once

#include "flushing/cache_layout.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

namespace fbf::testing {

using S = SessionFileState;

inline std::vector<FeedbackFile> drain(FeedbackEnumerator& e) {
  std::vector<FeedbackFile> out;
  while (auto f = e.next()) out.push_back(std::move(*f));
  return out;
}

class CacheTest : public ::testing::Test {
 protected:
  FileManager& fm() { return *env.fileManager; }
  fs::path cache() const { return env.cacheDir(); }
  fs::path session(S state, unsigned n, std::string_view suffix = "") {
    return makeFile(cache(), sessionName(state, n) + std::string(suffix));
  }
  std::vector<FeedbackFile> walkAll(const FileManager& manager) {
    auto e = FeedbackEnumerator::make(manager);
    if (!e) ADD_FAILURE() << "no enumerator";
    return e ? drain(*e) : std::vector<FeedbackFile>{};
  }

  TestEnvironment env;
  LogCapture logs;
};

}  // namespace fbf::testing
