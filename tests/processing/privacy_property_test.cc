// Over generated sessions with canaries planted in every identifier, visited
// address and engagement title: what leaves the device after processing
// carries none of the identifiers or visited addresses, titles survive only
// for the result types that keep them, and feedback times are relative to the
// session's first feedback.
#include "flushing/flushable_session.h"
#include "session_generator.h"

#include <gtest/gtest.h>

#include <set>

namespace fbf {
namespace {

bool keepsTitle(int32_t type) { return std::set<int32_t>{9, 10, 11, 12, 13, 14, 18, 19}.count(type) == 1; }

// Every canary-shaped token ("cnry" + kind letter + 16 hex digits) in a text.
std::set<std::string> canariesIn(const std::string& text) {
  std::set<std::string> found;
  for (size_t pos = text.find("cnry"); pos != std::string::npos; pos = text.find("cnry", pos + 1)) {
    found.insert(text.substr(pos, 21));
  }
  return found;
}

// The time of a payload's feedback (field 1 of every kind), if it has one.
std::optional<uint64_t> timeOf(const corevireon::CVFeedbackPayload& p) {
  if (p.codable_case() == corevireon::CVFeedbackPayload::CODABLE_NOT_SET) return std::nullopt;
  const auto* r = p.GetReflection();
  const auto& m = r->GetMessage(p, r->GetOneofFieldDescriptor(p, p.GetDescriptor()->FindOneofByName("codable")));
  return m.GetReflection()->GetUInt64(m, m.GetDescriptor()->FindFieldByNumber(1));
}

class PrivacyOverGeneratedSessions : public ::testing::TestWithParam<sessiongen::SizeMix> {};

// Guards against: an identifier, visited address or non-kept title leaving the device, or absolute times leaving.
TEST_P(PrivacyOverGeneratedSessions, NothingPlantedLeavesAndTimesAreRelative) {
  sessiongen::SessionGenerator generator({.seed = 20240611, .sizeMix = GetParam(), .plantCanaries = true});
  size_t keptTitlesSeen = 0, forbiddenChecked = 0, cbaKept = 0;
  for (int i = 0; i < (GetParam() == sessiongen::SizeMix::small ? 40 : 15); ++i) {
    SCOPED_TRACE("session " + std::to_string(i));
    sessiongen::GeneratedSession g = generator.nextSession();
    std::set<std::string> forbidden(g.canaries.identifiers.begin(), g.canaries.identifiers.end()), kept;
    forbidden.insert(g.canaries.visitedAddresses.begin(), g.canaries.visitedAddresses.end());
    uint64_t lo = UINT64_MAX, hi = 0;
    for (const auto& p : g.session.feedbacks().items()) {
      const auto& re = p.resultengagement();
      for (const auto& c : canariesIn(re.titletext())) (keepsTitle(re.result().type()) ? kept : forbidden).insert(c);
      if (auto t = timeOf(p)) lo = std::min(lo, *t), hi = std::max(hi, *t);
    }
    forbiddenChecked += forbidden.size();
    keptTitlesSeen += kept.size();

    // Through the bytes, as the flusher reads a session file.
    corevireon::CVClientSession decoded;
    ASSERT_TRUE(decoded.ParseFromString(g.session.SerializeAsString()));
    FlushableSession session(std::move(decoded));
    session.postProcessFeedback(nullptr);
    EXPECT_EQ(canariesIn(session.backingStore().SerializeAsString()), kept);
    EXPECT_EQ(canariesIn(session.generateSessionJSON().dump()), kept);

    bool first = true;
    for (const auto& p : session.backingStore().feedbacks().items()) {
      cbaKept += p.has_cbaengagement();  // its visited address is a planted canary
      auto t = timeOf(p);
      if (!t || p.has_sessionmissingresults() || p.has_sessionmissingsuggestions()) continue;
      EXPECT_TRUE(!first || *t == 0) << "the first time is " << *t;
      first = false;
      ASSERT_LE(*t, hi >= lo ? (hi - lo) / 1'000'000 : 0);
    }
  }
  // The property was exercised: titles were kept somewhere, visits matched.
  EXPECT_GT(keptTitlesSeen, 0u);
  EXPECT_GT(cbaKept, 0u);
  EXPECT_GT(forbiddenChecked, 500u);
}

INSTANTIATE_TEST_SUITE_P(SizeMixes, PrivacyOverGeneratedSessions,
                         ::testing::Values(sessiongen::SizeMix::small, sessiongen::SizeMix::realistic));

}  // namespace
}  // namespace fbf
