#include "flushing/session_processing_helper.h"
#include "processing/processing_builders.h"

#include <gtest/gtest.h>

#include <functional>

namespace fbf {
namespace {

using namespace fbf::testing;
using corevireon::CVSearchResultForFeedback;

std::vector<std::string> identifiersOf(const google::protobuf::RepeatedPtrField<CVSearchResultForFeedback>& rs) {
  std::vector<std::string> out;
  for (const auto& r : rs) out.push_back(r.has_identifier() ? r.identifier() : "<absent>");
  return out;
}

// Results and suggestions outside the per-kind table are found through the
// descriptors: mapped and stripped of their titles like the others, but they
// do not count as shown or delivered.
TEST(ItemsAnywhere, AreMappedAndStrippedWithoutBookkeeping) {
  struct Row {
    const char* name;
    std::function<void(corevireon::CVFeedbackPayload&)> build;
    std::function<const CVSearchResultForFeedback&(const corevireon::CVFeedbackPayload&)> item;
  };
  auto titled = [](int32_t type) {
    auto r = result("secret-id", type);
    r.set_title("secret title");
    return r;
  };
  const Row rows[] = {
      {"section header, plain type",
       [&](auto& p) {
         *p.mutable_visiblesectionheader()->mutable_section()->mutable_results()->add_items() = titled(2);
       },
       [](const auto& p) -> const auto& { return p.visiblesectionheader().section().results().items(0); }},
      {"missing results written by the search daemon",
       [&](auto& p) { *p.mutable_sessionmissingresults()->add_results() = titled(5); },
       [](const auto& p) -> const auto& { return p.sessionmissingresults().results(0); }},
  };
  for (const auto& row : rows) {
    SessionProcessingHelper helper;
    corevireon::CVFeedbackPayload payload;
    row.build(payload);
    helper.process(mutableCodableMessage(payload));
    EXPECT_EQ(row.item(payload).identifier(), "1") << row.name;
    EXPECT_FALSE(row.item(payload).has_title()) << row.name;
    EXPECT_EQ(helper.identifiersMapped(), 1u) << row.name;
    EXPECT_EQ(helper.titlesCleared(), 1u) << row.name;
    EXPECT_TRUE(helper.missingResults()->empty()) << row.name;
  }
  // A title-keeping type keeps it wherever it appears; a suggestion is mapped.
  SessionProcessingHelper helper;
  corevireon::CVFeedbackPayload payload;
  *payload.mutable_sessionmissingsuggestions()->add_suggestions() = suggestion("secret-s");
  helper.process(mutableCodableMessage(payload));
  EXPECT_EQ(payload.sessionmissingsuggestions().suggestions(0).identifier(), "1");
  corevireon::CVFeedbackPayload header;
  *header.mutable_visiblesectionheader()->mutable_section()->mutable_results()->add_items() = titled(9);
  helper.process(mutableCodableMessage(header));
  EXPECT_EQ(header.visiblesectionheader().section().results().items(0).title(), "secret title");
  EXPECT_EQ(header.visiblesectionheader().section().results().items(0).identifier(), "2");
}

// Replacement numbers are handed out per key (identifier + decimal type).
class IdentifierReplacement : public ::testing::Test {
 protected:
  SessionProcessingHelper helper;
};

TEST_F(IdentifierReplacement, SameIdentifierInTwoMessagesMapsOnce) {
  auto shown = visibleResults(1, {result("alpha", 3), result("beta", 3)});
  corevireon::CVResultEngagementFeedback engaged;
  *engaged.mutable_result() = result("alpha", 3);

  helper.process(shown.mutable_visibleresults());
  helper.process(&engaged);

  EXPECT_EQ(identifiersOf(shown.visibleresults().results()), (std::vector<std::string>{"1", "2"}));
  EXPECT_EQ(engaged.result().identifier(), "1");
  EXPECT_EQ(helper.nextMappedId(), 3);
}

TEST_F(IdentifierReplacement, SameIdentifierUnderAnotherTypeMapsAnew) {
  EXPECT_EQ(helper.replacementForIdentifier("alpha", 3), "1");
  EXPECT_EQ(helper.replacementForIdentifier("alpha", 4), "2");
  EXPECT_EQ(helper.replacementForIdentifier("alpha", 3), "1");
  EXPECT_EQ(helper.allIdSet(), (std::set<std::string>{"1", "2"}));
}

TEST_F(IdentifierReplacement, KeysHaveNoSeparatorSoAb17AndAb1With7Collide) {
  EXPECT_EQ(helper.replacementForIdentifier("ab", 17), "1");
  EXPECT_EQ(helper.replacementForIdentifier("ab1", 7), "1");
  EXPECT_EQ(helper.replacementForIdentifier("ab", 7), "2");
}

TEST_F(IdentifierReplacement, EmptyOrAbsentIdentifierBecomesAbsentAndUsesNoNumber) {
  EXPECT_EQ(helper.replacementForIdentifier(std::nullopt, 1), std::nullopt);
  EXPECT_EQ(helper.replacementForIdentifier("", 1), std::nullopt);
  auto shown = visibleResults(1, {result("", 2), result("x", 2)});
  helper.process(shown.mutable_visibleresults());
  EXPECT_FALSE(shown.visibleresults().results(0).has_identifier());
  EXPECT_EQ(shown.visibleresults().results(1).identifier(), "1");
}

TEST_F(IdentifierReplacement, NumberingRestartsForEverySession) {
  EXPECT_EQ(helper.replacementForIdentifier("x", 1), "1");
  SessionProcessingHelper next;
  EXPECT_EQ(next.replacementForIdentifier("y", 1), "1");
}

TEST_F(IdentifierReplacement, NumbersFollowFirstAppearanceBeyondNine) {
  for (int i = 0; i < 12; ++i) helper.replacementForIdentifier("id" + std::to_string(i), 0);
  auto shown = visibleResults(1, {result("id11", 0), result("id1", 0), result("new", 0)});
  helper.process(shown.mutable_visibleresults());
  EXPECT_EQ(identifiersOf(shown.visibleresults().results()), (std::vector<std::string>{"12", "2", "13"}));
}

// Referenced items that are never delivered in full become missing.
class ReferencedAndExpanded : public ::testing::Test {
 protected:
  SessionProcessingHelper helper;
};

TEST_F(ReferencedAndExpanded, ShownButNeverDeliveredIsMissingOnceWithItsReplacement) {
  auto first = visibleResults(1, {result("r", 5)});
  auto again = visibleResults(1, {result("r", 5)});
  helper.process(first.mutable_visibleresults());
  helper.process(again.mutable_visibleresults());
  auto missing = helper.missingResults();
  ASSERT_TRUE(missing);
  ASSERT_EQ(missing->size(), 1u);
  EXPECT_EQ((*missing)[0].identifier(), "1");
  EXPECT_EQ((*missing)[0].type(), 5);
}

TEST_F(ReferencedAndExpanded, ReferencedThenExpandedIsNotMissing) {
  auto shown = visibleResults(1, {result("r", 5)});
  corevireon::CVResultsReceivedAfterTimeoutFeedback delivered;
  *delivered.add_results() = result("r", 5);
  helper.process(shown.mutable_visibleresults());
  helper.process(&delivered);
  EXPECT_TRUE(helper.missingResults()->empty());
  EXPECT_EQ(helper.expandedIdSet(), std::set<std::string>{"1"});
}

TEST_F(ReferencedAndExpanded, ReferencedAfterExpansionIsNeverRecorded) {
  corevireon::CVResultRankingFeedback ranking;
  *ranking.mutable_result() = result("r", 5);
  helper.process(&ranking);
  auto shown = visibleResults(1, {result("r", 5)});
  helper.process(shown.mutable_visibleresults());
  EXPECT_TRUE(helper.missingResults()->empty());
}

TEST_F(ReferencedAndExpanded, SuggestionEngagedButNeverShownIsAMissingSuggestion) {
  corevireon::CVVisibleSuggestionsFeedback shown;
  *shown.add_suggestions() = suggestion("s1");
  corevireon::CVSuggestionEngagementFeedback engagedShown;
  *engagedShown.mutable_suggestion() = suggestion("s1");
  corevireon::CVSuggestionEngagementFeedback engagedUnknown;
  *engagedUnknown.mutable_suggestion() = suggestion("s2");
  helper.process(&shown);
  helper.process(&engagedShown);
  helper.process(&engagedUnknown);
  auto missing = helper.missingSuggestions();
  ASSERT_EQ(missing->size(), 1u);
  EXPECT_EQ((*missing)[0].identifier(), "2");
  EXPECT_TRUE(helper.missingResults()->empty());
}

TEST_F(ReferencedAndExpanded, FirstReferenceIsKept) {
  // Type 9 keeps its title, so the copy kept tells the two references apart.
  auto r1 = result("r", 9);
  r1.set_title("first");
  auto r2 = result("r", 9);
  r2.set_title("second");
  corevireon::CVResultGradingFeedback graded;
  *graded.mutable_result() = r1;
  corevireon::CVResultEngagementFeedback engaged;
  *engaged.mutable_result() = r2;
  helper.process(&graded);
  helper.process(&engaged);
  ASSERT_EQ(helper.missingResults()->size(), 1u);
  EXPECT_EQ(helper.missingResults()->front().title(), "first");
}

TEST_F(ReferencedAndExpanded, MissingResultsComeInOrderOfTheirNumbers) {
  std::initializer_list<CVSearchResultForFeedback> many = {
      result("a"), result("b"), result("c"), result("d"), result("e"), result("f"),
      result("g"), result("h"), result("i"), result("j"), result("k")};
  auto shown = visibleResults(1, many);
  helper.process(shown.mutable_visibleresults());
  std::vector<std::string> ids;
  const auto missing = helper.missingResults();
  for (const auto& r : *missing) ids.push_back(r.identifier());
  EXPECT_EQ(ids, (std::vector<std::string>{"1", "2", "3", "4", "5", "6", "7", "8", "9", "10", "11"}));
}

// Rankings are taken apart section by section.
class RankingProcessing : public ::testing::Test {
 protected:
  static corevireon::CVSectionRankingFeedback sectionRanking(const std::string& ranked, const std::string& inSection,
                                                             bool withResultRanking) {
    corevireon::CVSectionRankingFeedback sr;
    if (withResultRanking) *sr.add_results()->mutable_result() = result(ranked);
    *sr.mutable_section()->mutable_results()->add_items() = result(inSection);
    return sr;
  }
  SessionProcessingHelper helper;
};

TEST_F(RankingProcessing, ThreeSectionRankingsAreProcessedInOrderResultRankingsFirst) {
  corevireon::CVRankingFeedback ranking;
  *ranking.add_sections() = sectionRanking("a-ranked", "a-section", true);
  *ranking.add_sections() = sectionRanking("b-ranked", "b-section", true);
  *ranking.add_sections() = sectionRanking("c-ranked", "c-section", false);
  helper.process(&ranking);

  // The numbers handed out show the order in which the items were seen.
  EXPECT_EQ(ranking.sections(0).results(0).result().identifier(), "1");
  EXPECT_EQ(ranking.sections(1).results(0).result().identifier(), "3");
  EXPECT_EQ(ranking.sections(2).section().results().items(0).identifier(), "5");
  auto probe = visibleResults(1, {result("a-section"), result("b-section")});
  helper.process(probe.mutable_visibleresults());
  EXPECT_EQ(identifiersOf(probe.visibleresults().results()), (std::vector<std::string>{"2", "4"}));
  // Everything in a ranking counts as delivered.
  EXPECT_TRUE(helper.missingResults()->empty());
}

TEST_F(RankingProcessing, SectionResultsAreClearedOnlyWhenResultRankingsArePresent) {
  auto with = sectionRanking("r", "s", true);
  auto without = sectionRanking("", "t", false);
  helper.process(&with);
  helper.process(&without);
  EXPECT_TRUE(with.has_section());
  EXPECT_FALSE(with.section().has_results());
  ASSERT_TRUE(without.section().has_results());
  EXPECT_EQ(without.section().results().items(0).identifier(), "3");
}

TEST_F(RankingProcessing, ResultRankingExpandsDuplicatesHiddenAndResultInThatOrder) {
  corevireon::CVResultRankingFeedback rr;
  *rr.mutable_result() = result("main");
  *rr.add_duplicateresults() = result("dup");
  *rr.add_hiddenresults() = result("hidden");
  helper.process(&rr);
  EXPECT_EQ(rr.duplicateresults(0).identifier(), "1");
  EXPECT_EQ(rr.hiddenresults(0).identifier(), "2");
  EXPECT_EQ(rr.result().identifier(), "3");
  EXPECT_EQ(helper.expandedIdSet(), (std::set<std::string>{"1", "2", "3"}));
}

TEST_F(RankingProcessing, LateSectionsAreExpanded) {
  corevireon::CVLateSectionsAppendedFeedback late;
  *late.add_sections()->mutable_results()->add_items() = result("x");
  *late.add_sections()->mutable_results()->add_items() = result("y");
  helper.process(&late);
  EXPECT_EQ(late.sections(1).results().items(0).identifier(), "2");
  EXPECT_EQ(helper.expandedIdSet().size(), 2u);
}

// The privacy rewrites made while gathering.
class EngagementRewrites : public ::testing::TestWithParam<int32_t> {};

TEST_P(EngagementRewrites, TitleKeptOnlyForTheEightListedTypes) {
  const int32_t type = GetParam();
  const bool kept = type == 9 || type == 10 || type == 11 || type == 12 || type == 13 || type == 14 ||
                    type == 18 || type == 19;
  corevireon::CVResultEngagementFeedback engaged;
  *engaged.mutable_result() = result("r", type);
  engaged.set_titletext("what the user saw");
  engaged.set_matchesunengagedsuggestion(true);
  SessionProcessingHelper helper;
  helper.process(&engaged);
  EXPECT_EQ(engaged.has_titletext(), kept) << "type " << type;
  EXPECT_EQ(engaged.matchesunengagedsuggestion(), kept) << "type " << type;
}

INSTANTIATE_TEST_SUITE_P(ResultTypes, EngagementRewrites, ::testing::Range(0, 22));

TEST(EngagementWithoutResult, LosesItsTitle) {
  corevireon::CVResultEngagementFeedback engaged;
  engaged.set_titletext("title");
  SessionProcessingHelper helper;
  helper.process(&engaged);
  EXPECT_FALSE(engaged.has_titletext());
}

class SectionEngagementRewrites : public ::testing::Test {
 protected:
  corevireon::CVSectionEngagementFeedback engagement(corevireon::CVTriggerEngagementEvent trigger) {
    corevireon::CVSectionEngagementFeedback se;
    se.set_triggerevent(trigger);
    se.mutable_section()->set_bundleidentifier("vireon.apps");
    *se.mutable_section()->mutable_results()->add_items() = result("r");
    return se;
  }
  SessionProcessingHelper helper;
};

TEST_F(SectionEngagementRewrites, ResultsRemovedUnlessExpandedButStillReferenced) {
  auto tapped = engagement(corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP);
  helper.process(&tapped);
  EXPECT_FALSE(tapped.section().has_results());
  EXPECT_EQ(tapped.section().bundleidentifier(), "vireon.apps");
  ASSERT_EQ(helper.missingResults()->size(), 1u);
  EXPECT_EQ(helper.missingResults()->front().identifier(), "1");
}

TEST_F(SectionEngagementRewrites, ExpandTriggerKeepsTheResults) {
  auto expanded = engagement(corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND);
  helper.process(&expanded);
  ASSERT_TRUE(expanded.section().has_results());
  EXPECT_EQ(expanded.section().results().items(0).identifier(), "1");
}

class LocalApplicationCodes : public ::testing::Test {
 protected:
  static CVSearchResultForFeedback app(int32_t type) {
    auto r = result("app", type);
    r.set_islocalapplicationresult(true);
    r.set_knownapplicationbundleidentifier(77);
    r.set_knownresultbundleid(78);
    return r;
  }
  SessionProcessingHelper helper;
};

TEST_F(LocalApplicationCodes, SetToTwoUnlessType20AndCarriedIntoTheMissingList) {
  auto shown = visibleResults(1, {app(3), app(20)});
  auto notLocal = result("web", 3);
  notLocal.set_knownresultbundleid(5);
  *shown.mutable_visibleresults()->add_results() = notLocal;
  helper.process(shown.mutable_visibleresults());
  const auto& rs = shown.visibleresults().results();
  EXPECT_EQ(rs[0].knownapplicationbundleidentifier(), 2);
  EXPECT_EQ(rs[0].knownresultbundleid(), 2);
  EXPECT_EQ(rs[1].knownapplicationbundleidentifier(), 77);
  EXPECT_EQ(rs[1].knownresultbundleid(), 78);
  EXPECT_EQ(rs[2].knownresultbundleid(), 5);
  ASSERT_EQ(helper.missingResults()->size(), 3u);
  EXPECT_EQ(helper.missingResults()->front().knownresultbundleid(), 2);
}

TEST(Redaction, ClearsQueryTextsAndPunchoutExceptForType1) {
  auto r = webResult("x", "https://example.com/");
  r.set_userinput("typed");
  r.set_completedquery("completed");
  r.set_intendedquery("intended");
  r.set_title("kept");
  auto typeOne = r;
  r.set_type(2);
  redact(r);
  redact(typeOne);
  EXPECT_FALSE(r.has_userinput() || r.has_completedquery() || r.has_intendedquery() || r.has_punchout());
  EXPECT_EQ(r.title(), "kept");
  EXPECT_TRUE(typeOne.has_userinput() && typeOne.has_punchout());
}

TEST(ContainedResults, FollowTheKindsOfFeedback) {
  corevireon::CVRankingFeedback ranking;
  auto* sr = ranking.add_sections();
  *sr->add_results()->mutable_result() = result("ranked-only");
  *sr->mutable_section()->mutable_results()->add_items() = result("s1");
  *ranking.add_sections()->mutable_section()->mutable_results()->add_items() = result("s2");
  std::vector<std::string> ids;
  for (const auto* r : containedResults(ranking)) ids.push_back(r->identifier());
  EXPECT_EQ(ids, (std::vector<std::string>{"s1", "s2"}));

  corevireon::CVResultRankingFeedback rr;
  *rr.mutable_result() = result("main");
  *rr.add_hiddenresults() = result("hidden");
  *rr.add_duplicateresults() = result("dup");
  ids.clear();
  for (const auto* r : containedResults(rr)) ids.push_back(r->identifier());
  EXPECT_EQ(ids, (std::vector<std::string>{"dup", "hidden", "main"}));

  corevireon::CVClearInputFeedback other;
  EXPECT_TRUE(containedResults(other).empty());
}

}  // namespace
}  // namespace fbf
