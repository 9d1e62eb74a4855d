#include "flushing/session_recovery.h"

#include "flushing/cache_fixture.h"

namespace fbf::testing {
namespace {

// Guards against: sessions lost or sent twice after a kill, and a crash loop on
// one bad session (start-up recovery of what an earlier run left half-way).
using SessionRecovery = CacheTest;

std::string processing(unsigned n) { return sessionName(S::processing, n); }
std::string uploadOf(unsigned n, const char* format) {
  return processing(n) + "." + format + ".uploadPending";
}

TEST_F(SessionRecovery, EachLeftoverEndsInTheRightState) {
  const fs::path crowd = cache() / "CustomFeedback" / "Crowdsourcing";
  makeFile(cache(), processing(1));
  makeFile(cache(), uploadOf(1, "pb"));  // payload safe: the processing file goes
  makeFile(cache(), processing(2));
  makeFile(cache(), uploadOf(2, "json"));
  makeFile(cache(), processing(3));                         // no upload file: back to closed, once
  session(S::closed, 4);                                    // untouched
  makeFile(cache(), "." + uploadOf(5, "pb") + ".partial");  // half-written upload
  makeFile(crowd, "report");
  makeFile(crowd, "report.uploadPending");  // compressed copy made: source goes
  makeFile(crowd, "other");                 // untouched

  auto first = recoverInterruptedFiles(fm(), false);
  EXPECT_EQ(first.processingRemoved, 2u);
  EXPECT_EQ(first.returnedToClosed, 1u);
  EXPECT_EQ(first.customRemoved, 1u);
  EXPECT_EQ(first.partialsRemoved, 1u);
  EXPECT_EQ(entryNames(cache()),
            (std::vector<std::string>{"CustomFeedback", "fbf-interrupted", uploadOf(1, "pb"),
                                      uploadOf(2, "json"), sessionName(S::closed, 3),
                                      sessionName(S::closed, 4)}));
  EXPECT_EQ(entryNames(crowd), (std::vector<std::string>{"other", "report.uploadPending"}));

  // Session 3 is interrupted again: it is kept as it is, and listed.
  fs::rename(cache() / sessionName(S::closed, 3), cache() / processing(3));
  auto second = recoverInterruptedFiles(fm(), false);
  EXPECT_EQ(second.returnedToClosed, 0u);
  EXPECT_EQ(second.poisonFiles, 1u);
  EXPECT_EQ(poisonSessionFiles(fm()), std::vector<fs::path>{cache() / processing(3)});

  // Once the session is gone, so is its mark.
  fs::remove(cache() / processing(3));
  recoverInterruptedFiles(fm(), false);
  EXPECT_TRUE(interruptedSessionIDs(fm()).empty());
}

TEST_F(SessionRecovery, LeaveFeedbackAfterUploadKeepsTheSessionBesideItsUpload) {
  makeFile(cache(), processing(1));
  makeFile(cache(), uploadOf(1, "pb"));
  recoverInterruptedFiles(fm(), true);
  EXPECT_TRUE(fs::exists(cache() / processing(1)));
}

}  // namespace
}  // namespace fbf::testing
