#include "flushing/session_processing_helper.h"
#include "processing/processing_builders.h"

#include <gtest/gtest.h>

namespace fbf {
namespace {

using namespace fbf::testing;
using corevireon::CVFeedbackPayload;
using corevireon::CVSearchResultForFeedback;

template <typename Items>
std::string idsOf(const Items& items) {
  std::string out;
  for (const auto& r : items) out += (out.empty() ? "" : " ") + (r.has_identifier() ? r.identifier() : "-");
  return out;
}

// Processes each payload's feedback in turn, as a session does.
void processAll(SessionProcessingHelper& helper, std::vector<CVFeedbackPayload>& payloads) {
  for (auto& p : payloads) helper.process(mutableCodableMessage(p));
}

CVSearchResultForFeedback titled(const std::string& id, int32_t type, const std::string& title = "secret title") {
  auto r = result(id, type);
  r.set_title(title);
  return r;
}

// Guards against: replacement numbers reused across keys, handed out twice for one key, or given to empty identifiers.
TEST(IdentifierReplacement, OneNumberPerIdentifierAndTypeInOrderOfFirstAppearance) {
  struct Call {
    std::optional<std::string> id;
    int32_t type;
    std::optional<std::string> expected;
  };
  const std::pair<const char*, std::vector<Call>> rows[] = {
      {"another type maps anew", {{"alpha", 3, "1"}, {"alpha", 4, "2"}, {"alpha", 3, "1"}}},
      {"keys have no separator: ab+17 is ab1+7", {{"ab", 17, "1"}, {"ab1", 7, "1"}, {"ab", 7, "2"}}},
      {"empty or absent uses no number", {{std::nullopt, 1, std::nullopt}, {"", 1, std::nullopt}, {"x", 1, "1"}}},
  };
  for (const auto& [name, calls] : rows) {
    SCOPED_TRACE(name);
    SessionProcessingHelper helper;
    for (const auto& c : calls) EXPECT_EQ(helper.replacementForIdentifier(c.id, c.type), c.expected);
  }
  // Through the messages: one number per key across kinds, counted past nine.
  SessionProcessingHelper helper;
  for (int i = 0; i < 12; ++i) helper.replacementForIdentifier("id" + std::to_string(i), 0);
  std::vector<CVFeedbackPayload> payloads = {
      visibleResults(1, {result("id11", 0), result("id1", 0), result("new", 0), result("", 0)}),
      payloadWith([](auto& p) { *p.mutable_resultengagement()->mutable_result() = result("new", 0); })};
  processAll(helper, payloads);
  EXPECT_EQ(idsOf(payloads[0].visibleresults().results()), "12 2 13 -");
  EXPECT_EQ(payloads[1].resultengagement().result().identifier(), "13");
  EXPECT_EQ(helper.nextMappedId(), 14);
}

// Guards against: an item referenced but never delivered in full not being reported missing (or reported twice,
// out of order, or when it was delivered).
TEST(ReferencedAndExpanded, MissingItemsAreTheReferencedOnesNeverExpanded) {
  auto shown = [](const std::string& id) { return visibleResults(1, {result(id, 5)}); };
  auto late = [](const std::string& id) {
    return payloadWith([&](auto& p) { *p.mutable_resultsreceivedaftertimeout()->add_results() = result(id, 5); });
  };
  auto ranked = [](const std::string& id) {
    return payloadWith([&](auto& p) { *p.mutable_resultranking()->mutable_result() = result(id, 5); });
  };
  auto suggested = [](const std::string& id, bool engaged) {
    return payloadWith([&](auto& p) {
      *(engaged ? p.mutable_suggestionengagement()->mutable_suggestion()
                : p.mutable_visiblesuggestions()->add_suggestions()) = suggestion(id);
    });
  };
  auto graded = [](auto mutableKind, const char* title) {
    return payloadWith([&](auto& p) { *(p.*mutableKind)()->mutable_result() = titled("r", 9, title); });
  };
  struct Row {
    const char* name;
    std::vector<CVFeedbackPayload> payloads;
    std::string missingResults, missingSuggestions;  // "identifier:type[:title]" each
  };
  Row rows[] = {
      {"shown twice, never delivered: missing once", {shown("r"), shown("r")}, "1:5", ""},
      {"shown, then delivered", {shown("r"), late("r")}, "", ""},
      {"delivered, then shown", {ranked("r"), shown("r")}, "", ""},
      {"suggestion engaged, never shown", {suggested("s1", false), suggested("s1", true), suggested("s2", true)},
       "", "2:1"},
      {"the first reference is kept (type 9 keeps titles)",
       {graded(&CVFeedbackPayload::mutable_resultgrading, "first"),
        graded(&CVFeedbackPayload::mutable_resultengagement, "second")},
       "1:9:first", ""},
      {"in the order of their numbers",
       {visibleResults(1, {result("a"), result("b"), result("c"), result("d"), result("e"), result("f"),
                           result("g"), result("h"), result("i"), result("j"), result("k")})},
       "1:2 2:2 3:2 4:2 5:2 6:2 7:2 8:2 9:2 10:2 11:2", ""},
  };
  auto describe = [](const auto& items) {
    std::string out;
    for (const auto& r : *items) {
      out += (out.empty() ? "" : " ") + r.identifier() + ":" + std::to_string(r.type());
      if constexpr (requires { r.title(); }) out += r.has_title() ? ":" + r.title() : "";
    }
    return out;
  };
  for (auto& row : rows) {
    SCOPED_TRACE(row.name);
    SessionProcessingHelper helper;
    processAll(helper, row.payloads);
    ASSERT_TRUE(helper.missingResults() && helper.missingSuggestions());
    EXPECT_EQ(describe(helper.missingResults()), row.missingResults);
    EXPECT_EQ(describe(helper.missingSuggestions()), row.missingSuggestions);
  }
}

// Guards against: rankings processed in the wrong order, section results kept beside result rankings, or
// ranked items not counting as delivered.
TEST(RankingProcessing, SectionsInOrderResultRankingsFirst) {
  auto sectionRanking = [](corevireon::CVSectionRankingFeedback* sr, const std::string& ranked,
                           const std::string& inSection) {
    if (!ranked.empty()) *sr->add_results()->mutable_result() = result(ranked);
    *sr->mutable_section()->mutable_results()->add_items() = result(inSection);
  };
  SessionProcessingHelper helper;
  std::vector<CVFeedbackPayload> payloads = {payloadWith([&](auto& p) {
    sectionRanking(p.mutable_ranking()->add_sections(), "a-ranked", "a-section");
    sectionRanking(p.mutable_ranking()->add_sections(), "b-ranked", "b-section");
    sectionRanking(p.mutable_ranking()->add_sections(), "", "c-section");
  })};
  processAll(helper, payloads);
  const auto& ranking = payloads[0].ranking();
  EXPECT_EQ(ranking.sections(0).results(0).result().identifier(), "1");
  EXPECT_EQ(ranking.sections(1).results(0).result().identifier(), "3");
  EXPECT_FALSE(ranking.sections(1).section().has_results());  // cleared beside result rankings
  ASSERT_TRUE(ranking.sections(2).section().has_results());
  EXPECT_EQ(ranking.sections(2).section().results().items(0).identifier(), "5");
  auto probe = visibleResults(1, {result("a-section"), result("b-section")});
  helper.process(probe.mutable_visibleresults());
  EXPECT_EQ(idsOf(probe.visibleresults().results()), "2 4");
  EXPECT_TRUE(helper.missingResults()->empty());

  corevireon::CVResultRankingFeedback rr;
  *rr.mutable_result() = result("main");
  *rr.add_duplicateresults() = result("dup");
  *rr.add_hiddenresults() = result("hidden");
  corevireon::CVLateSectionsAppendedFeedback late;
  *late.add_sections()->mutable_results()->add_items() = result("x");
  *late.add_sections()->mutable_results()->add_items() = result("y");
  SessionProcessingHelper other;
  other.process(&rr);
  other.process(&late);
  EXPECT_EQ(idsOf(rr.duplicateresults()) + " " + idsOf(rr.hiddenresults()) + " " + rr.result().identifier(), "1 2 3");
  EXPECT_EQ(late.sections(1).results().items(0).identifier(), "5");
  EXPECT_EQ(other.expandedIdSet(), (std::set<std::string>{"1", "2", "3", "4", "5"}));
}

// Guards against: a title or an unengaged-suggestion flag leaving for a result type that must not keep it.
TEST(EngagementRewrites, TitleKeptOnlyForTheEightListedTypes) {
  const std::set<int32_t> keeping = {9, 10, 11, 12, 13, 14, 18, 19};
  for (int32_t type = 0; type < 22; ++type) {
    corevireon::CVResultEngagementFeedback engaged;
    *engaged.mutable_result() = result("r", type);
    engaged.set_titletext("what the user saw");
    engaged.set_matchesunengagedsuggestion(true);
    SessionProcessingHelper().process(&engaged);
    EXPECT_EQ(engaged.has_titletext(), keeping.count(type) == 1) << "type " << type;
    EXPECT_EQ(engaged.matchesunengagedsuggestion(), keeping.count(type) == 1) << "type " << type;
  }
  corevireon::CVResultEngagementFeedback withoutResult;
  withoutResult.set_titletext("title");
  SessionProcessingHelper().process(&withoutResult);
  EXPECT_FALSE(withoutResult.has_titletext());
}

// Guards against: items outside the per-kind table escaping the rewrite, or counting as shown.
TEST(ItemsAnywhere, AreMappedAndStrippedWithoutBookkeeping) {
  SessionProcessingHelper helper;
  std::vector<CVFeedbackPayload> payloads = {
      payloadWith([](auto& p) {
        *p.mutable_visiblesectionheader()->mutable_section()->mutable_results()->add_items() = titled("a", 2);
      }),
      payloadWith([](auto& p) { *p.mutable_sessionmissingresults()->add_results() = titled("b", 5); }),
      payloadWith([](auto& p) { *p.mutable_sessionmissingsuggestions()->add_suggestions() = suggestion("c"); }),
      payloadWith([](auto& p) {
        *p.mutable_visiblesectionheader()->mutable_section()->mutable_results()->add_items() = titled("d", 9);
      })};
  processAll(helper, payloads);
  const auto& header = payloads[0].visiblesectionheader().section().results().items(0);
  const auto& missing = payloads[1].sessionmissingresults().results(0);
  const auto& kept = payloads[3].visiblesectionheader().section().results().items(0);
  EXPECT_EQ(header.identifier() + missing.identifier() + kept.identifier(), "124");
  EXPECT_EQ(payloads[2].sessionmissingsuggestions().suggestions(0).identifier(), "3");
  EXPECT_FALSE(header.has_title() || missing.has_title());
  EXPECT_EQ(kept.title(), "secret title");
  EXPECT_EQ(helper.identifiersMapped(), 4u);
  EXPECT_EQ(helper.titlesCleared(), 2u);
  EXPECT_TRUE(helper.missingResults()->empty() && helper.missingSuggestions()->empty());
}

// Guards against: an engaged section keeping its results (or an expanded one losing them).
TEST(SectionEngagementRewrites, ResultsRemovedUnlessExpandedButStillReferenced) {
  for (auto trigger : {corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_TAP, corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND}) {
    const bool expand = trigger == corevireon::CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND;
    corevireon::CVSectionEngagementFeedback se;
    se.set_triggerevent(trigger);
    se.mutable_section()->set_bundleidentifier("vireon.apps");
    *se.mutable_section()->mutable_results()->add_items() = result("r");
    SessionProcessingHelper helper;
    helper.process(&se);
    EXPECT_EQ(se.section().bundleidentifier(), "vireon.apps");
    ASSERT_EQ(se.section().has_results(), expand);
    if (expand) {
      EXPECT_EQ(se.section().results().items(0).identifier(), "1");
    } else {
      EXPECT_EQ(idsOf(*helper.missingResults()), "1");
    }
  }
}

// Guards against: local application codes leaving unmasked, or masked for type 20 or non-local results.
TEST(LocalApplicationCodes, SetToTwoUnlessType20AndCarriedIntoTheMissingList) {
  auto shown = visibleResults(1, {result("app", 3), result("app", 20), result("web", 3)});
  for (int i = 0; i < 3; ++i) {
    auto* r = shown.mutable_visibleresults()->mutable_results(i);
    r->set_islocalapplicationresult(i < 2);
    r->set_knownapplicationbundleidentifier(77);
    r->set_knownresultbundleid(78);
  }
  SessionProcessingHelper helper;
  helper.process(shown.mutable_visibleresults());
  std::string codes;
  for (const auto& r : shown.visibleresults().results()) {
    codes += std::to_string(r.knownapplicationbundleidentifier()) + "/" + std::to_string(r.knownresultbundleid()) + " ";
  }
  EXPECT_EQ(codes, "2/2 77/78 77/78 ");
  ASSERT_EQ(helper.missingResults()->size(), 3u);
  EXPECT_EQ(helper.missingResults()->front().knownresultbundleid(), 2);
}

// Guards against: query texts or punch-outs leaving for a result type other than 1, or the title being cleared.
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
  EXPECT_TRUE(typeOne.has_userinput() && typeOne.has_completedquery() && typeOne.has_intendedquery() &&
              typeOne.has_punchout());
}

// Guards against: the results a feedback contains being gathered from the wrong fields or in the wrong order.
TEST(ContainedResults, FollowTheKindsOfFeedback) {
  auto ids = [](const auto& feedback) {
    std::string out;
    for (const auto* r : containedResults(feedback)) out += r->identifier() + " ";
    return out;
  };
  corevireon::CVRankingFeedback ranking;
  auto* sr = ranking.add_sections();
  *sr->add_results()->mutable_result() = result("ranked-only");
  *sr->mutable_section()->mutable_results()->add_items() = result("s1");
  *ranking.add_sections()->mutable_section()->mutable_results()->add_items() = result("s2");
  EXPECT_EQ(ids(ranking), "s1 s2 ");
  corevireon::CVResultRankingFeedback rr;
  *rr.mutable_result() = result("main");
  *rr.add_hiddenresults() = result("hidden");
  *rr.add_duplicateresults() = result("dup");
  EXPECT_EQ(ids(rr), "dup hidden main ");
  EXPECT_EQ(ids(corevireon::CVClearInputFeedback()), "");
}

}  // namespace
}  // namespace fbf
