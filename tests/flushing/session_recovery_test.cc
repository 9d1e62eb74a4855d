// Start-up recovery after a crash: which leftovers go, which come back for
// another try, and which are kept as poison. Guards against sessions lost or
// sent twice after a kill, and against a crash loop on one bad session.
#include "flushing/session_recovery.h"

#include "flushing/flushing_test_util.h"
#include "support/test_support.h"

#include <gtest/gtest.h>

namespace fbf::testing {
namespace {

std::string processing(unsigned n) { return sessionName(SessionFileState::processing, n); }
std::string closed(unsigned n) { return sessionName(SessionFileState::closed, n); }
std::string uploadOf(unsigned n, const char* format) { return processing(n) + "." + format + ".uploadPending"; }

TEST(SessionRecovery, EachLeftoverEndsInTheRightState) {
  TestEnvironment env;
  auto& fm = *env.fileManager;
  const fs::path cache = env.cacheDir();
  const fs::path crowd = cache / "CustomFeedback" / "Crowdsourcing";
  fs::create_directories(crowd);

  makeFile(cache, processing(1));
  makeFile(cache, uploadOf(1, "pb"));  // payload safe: the processing file goes
  makeFile(cache, processing(2));
  makeFile(cache, uploadOf(2, "json"));
  makeFile(cache, processing(3));      // no upload file: back to closed, once
  makeFile(cache, closed(4));          // untouched
  makeFile(cache, "." + uploadOf(5, "pb") + ".partial");  // half-written upload
  makeFile(crowd, "report");
  makeFile(crowd, "report.uploadPending");  // compressed copy made: source goes
  makeFile(crowd, "other");                 // untouched

  auto first = recoverInterruptedFiles(fm, false);
  EXPECT_EQ(first.processingRemoved, 2u);
  EXPECT_EQ(first.returnedToClosed, 1u);
  EXPECT_EQ(first.customRemoved, 1u);
  EXPECT_EQ(first.partialsRemoved, 1u);
  auto names = entryNames(cache);
  const std::vector<std::string> expectedCache = {
      "CustomFeedback", closed(3), closed(4), "fbf-interrupted", uploadOf(1, "pb"), uploadOf(2, "json")};
  for (const auto& n : expectedCache) EXPECT_NE(std::find(names.begin(), names.end(), n), names.end()) << n;
  EXPECT_EQ(entryNames(crowd), (std::vector<std::string>{"other", "report.uploadPending"}));

  // Session 3 is interrupted again: it is kept as it is, and listed.
  fs::rename(cache / closed(3), cache / processing(3));
  auto second = recoverInterruptedFiles(fm, false);
  EXPECT_EQ(second.returnedToClosed, 0u);
  EXPECT_EQ(second.poisonFiles, 1u);
  EXPECT_TRUE(fs::exists(cache / processing(3)));
  EXPECT_EQ(poisonSessionFiles(fm), std::vector<fs::path>{cache / processing(3)});

  // Once the session is gone, so is its mark.
  fs::remove(cache / processing(3));
  recoverInterruptedFiles(fm, false);
  EXPECT_TRUE(interruptedSessionIDs(fm).empty());
}

TEST(SessionRecovery, LeaveFeedbackAfterUploadKeepsTheSessionBesideItsUpload) {
  TestEnvironment env;
  makeFile(env.cacheDir(), processing(1));
  makeFile(env.cacheDir(), uploadOf(1, "pb"));
  recoverInterruptedFiles(*env.fileManager, true);
  EXPECT_TRUE(fs::exists(env.cacheDir() / processing(1)));
}

}  // namespace
}  // namespace fbf::testing
