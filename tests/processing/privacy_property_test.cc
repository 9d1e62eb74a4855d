// Over many generated sessions with canaries planted in every identifier,
// visited address and engagement title: what leaves the device after
// processing carries none of the identifiers or visited addresses, titles
// survive only for the result types that keep them, and feedback timestamps
// are relative to the session's first feedback.
#include "flushing/flushable_session.h"
#include "session_generator.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <set>
#include <unordered_set>

namespace fbf {
namespace {

using corevireon::CVClientSession;

constexpr size_t kCanaryLength = 21;  // "cnry" + kind letter + 16 hex digits
constexpr std::array<int32_t, 8> kTitleKeepingTypes = {9, 10, 11, 12, 13, 14, 18, 19};

bool keepsTitle(int32_t type) {
  return std::find(kTitleKeepingTypes.begin(), kTitleKeepingTypes.end(), type) != kTitleKeepingTypes.end();
}

// Every canary-shaped token in a text.
std::vector<std::string> canariesIn(const std::string& text) {
  std::vector<std::string> found;
  for (size_t pos = text.find("cnry"); pos != std::string::npos; pos = text.find("cnry", pos + 1)) {
    found.push_back(text.substr(pos, kCanaryLength));
  }
  return found;
}

struct Expectations {
  std::unordered_set<std::string> forbidden;     // must not appear anywhere
  std::unordered_set<std::string> keptTitles;    // must appear
  uint64_t longestRelativeMs = 0;
};

Expectations expectationsFor(const sessiongen::GeneratedSession& g) {
  Expectations e;
  for (const auto& c : g.canaries.identifiers) e.forbidden.insert(c);
  for (const auto& c : g.canaries.visitedAddresses) e.forbidden.insert(c);
  uint64_t lo = UINT64_MAX, hi = 0;
  for (const auto& p : g.session.feedbacks().items()) {
    const google::protobuf::Message* m = nullptr;
    if (p.has_resultengagement()) {
      const auto& re = p.resultengagement();
      for (const auto& c : canariesIn(re.titletext())) {
        (re.has_result() && keepsTitle(re.result().type()) ? e.keptTitles : e.forbidden).insert(c);
      }
    }
    if (p.codable_case() != corevireon::CVFeedbackPayload::CODABLE_NOT_SET) {
      const auto* r = p.GetReflection();
      m = &r->GetMessage(p, r->GetOneofFieldDescriptor(p, p.GetDescriptor()->FindOneofByName("codable")));
      const uint64_t t = m->GetReflection()->GetUInt64(*m, m->GetDescriptor()->FindFieldByNumber(1));
      lo = std::min(lo, t);
      hi = std::max(hi, t);
    }
  }
  e.longestRelativeMs = hi >= lo ? (hi - lo) / 1'000'000 : 0;
  return e;
}

class PrivacyOverGeneratedSessions : public ::testing::TestWithParam<sessiongen::SizeMix> {};

TEST_P(PrivacyOverGeneratedSessions, NothingPlantedLeavesAndTimesAreRelative) {
  sessiongen::GeneratorOptions options;
  options.seed = 20240611;
  options.sizeMix = GetParam();
  options.plantCanaries = true;
  sessiongen::SessionGenerator generator(options);
  const int sessions = GetParam() == sessiongen::SizeMix::small ? 150 : 60;

  size_t keptTitlesSeen = 0, forbiddenChecked = 0, cbaKept = 0;
  for (int i = 0; i < sessions; ++i) {
    sessiongen::GeneratedSession g = generator.nextSession();
    const Expectations e = expectationsFor(g);
    ASSERT_FALSE(e.forbidden.empty());
    forbiddenChecked += e.forbidden.size();

    // Through the bytes, as the flusher reads a session file.
    CVClientSession decoded;
    ASSERT_TRUE(decoded.ParseFromString(g.session.SerializeAsString()));
    FlushableSession session(std::move(decoded));
    session.postProcessFeedback(nullptr);
    const std::string protobuf = session.backingStore().SerializeAsString();
    const std::string json = session.generateSessionJSON().dump();

    for (const std::string* upload : {&protobuf, &json}) {
      std::set<std::string> titlesFound;
      for (const auto& c : canariesIn(*upload)) {
        ASSERT_EQ(e.forbidden.count(c), 0u) << "session " << i << " leaks " << c;
        ASSERT_EQ(e.keptTitles.count(c), 1u) << "session " << i << " has an unplanted token " << c;
        titlesFound.insert(c);
      }
      EXPECT_EQ(titlesFound.size(), e.keptTitles.size()) << "session " << i;
    }
    keptTitlesSeen += e.keptTitles.size();

    bool first = true;
    for (const auto& p : session.backingStore().feedbacks().items()) {
      if (p.has_resultengagement() && p.resultengagement().has_titletext()) {
        EXPECT_TRUE(keepsTitle(p.resultengagement().result().type()));
      }
      if (p.has_cbaengagement()) {
        EXPECT_FALSE(p.cbaengagement().has_url());
        EXPECT_GT(p.cbaengagement().cbatype(), 0);
        ++cbaKept;
      }
      if (p.has_sessionmissingresults() || p.has_sessionmissingsuggestions()) continue;
      if (p.codable_case() == corevireon::CVFeedbackPayload::CODABLE_NOT_SET) continue;
      const auto* r = p.GetReflection();
      const auto& m = r->GetMessage(p, r->GetOneofFieldDescriptor(p, p.GetDescriptor()->FindOneofByName("codable")));
      const uint64_t t = m.GetReflection()->GetUInt64(m, m.GetDescriptor()->FindFieldByNumber(1));
      if (first) {
        EXPECT_EQ(t, 0u) << "session " << i;
      }
      first = false;
      ASSERT_LE(t, e.longestRelativeMs) << "session " << i;
    }
  }
  // The property was exercised: titles were kept somewhere, visits matched.
  EXPECT_GT(keptTitlesSeen, 0u);
  EXPECT_GT(cbaKept, 0u);
  EXPECT_GT(forbiddenChecked, 1000u);
}

INSTANTIATE_TEST_SUITE_P(SizeMixes, PrivacyOverGeneratedSessions,
                         ::testing::Values(sessiongen::SizeMix::small, sessiongen::SizeMix::realistic));

TEST(GeneratedSessions, AreDeterministicForASeed) {
  sessiongen::GeneratorOptions options;
  options.seed = 99;
  options.plantCanaries = true;
  sessiongen::SessionGenerator a(options), b(options);
  for (int i = 0; i < 5; ++i) {
    EXPECT_TRUE(sessiongen::serializeDeterministically(a.nextSession().session) ==
                sessiongen::serializeDeterministically(b.nextSession().session))
        << "session " << i;
  }
  options.seed = 100;
  sessiongen::SessionGenerator c(options);
  EXPECT_FALSE(sessiongen::serializeDeterministically(a.nextSession().session) ==
               sessiongen::serializeDeterministically(c.nextSession().session));
}

}  // namespace
}  // namespace fbf
