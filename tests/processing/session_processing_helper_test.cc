#include "flushing/reporters.h"
#include "flushing/session_processing_helper.h"
#include "processing/processing_builders.h"

namespace fbf::testing {
namespace {

using corevireon::CVFeedbackPayload;
using corevireon::CVSearchResultForFeedback;

template <typename Items>
std::string idsOf(const Items& items) {
  std::string out;
  for (const auto& r : items) out += (out.empty() ? "" : " ") + (r.has_identifier() ? r.identifier() : "-");
  return out;
}

// Messages in their short text form, " | " between them.
template <typename Messages>
std::string join(const Messages& messages) {
  std::string out;
  for (const auto& m : messages) out += (out.empty() ? "" : " | ") + m.ShortDebugString();
  return out;
}

// Processes each payload's feedback in turn, as a session does.
void processAll(SessionProcessingHelper& helper, std::vector<CVFeedbackPayload>& payloads) {
  for (auto& p : payloads) helper.process(mutableCodableMessage(p));
}

// A table row's payloads in text form, parsed and processed in turn.
std::vector<CVFeedbackPayload> processRow(SessionProcessingHelper& helper, const std::vector<std::string>& texts) {
  std::vector<CVFeedbackPayload> payloads;
  for (const auto& text : texts) payloads.push_back(pb(text));
  processAll(helper, payloads);
  return payloads;
}

// Guards against: replacement numbers reused across keys, handed out twice for one key, or given to empty identifiers.
TEST(IdentifierReplacement, OneNumberPerIdentifierAndTypeInOrderOfFirstAppearance) {
  SessionProcessingHelper helper;
  for (int i = 0; i < 9; ++i) helper.replacementForIdentifier("id" + std::to_string(i), 0);
  // Keys are identifier + decimal type with no separator, so ab+17 and ab1+7 share a number.
  std::vector<CVFeedbackPayload> payloads = {
      pb(R"(visibleResults { results { identifier: "alpha" type: 3 } results { identifier: "alpha" type: 4 }
           results { identifier: "alpha" type: 3 } results { identifier: "ab" type: 17 } results { identifier: "ab1" type: 7 }
           results { identifier: "ab" type: 7 } results { identifier: "" } results { } results { identifier: "id1" } })"),
      pb(R"(resultEngagement { result { identifier: "ab" type: 7 } })")};
  processAll(helper, payloads);
  EXPECT_EQ(idsOf(payloads[0].visibleresults().results()), "10 11 10 12 12 13 - - 2");
  EXPECT_EQ(payloads[1].resultengagement().result().identifier(), "13");
  EXPECT_EQ(helper.nextMappedId(), 14);
}

// Guards against: an item referenced but never delivered not reported missing (or reported twice or out of order).
TEST(ReferencedAndExpanded, MissingItemsAreTheReferencedOnesNeverExpanded) {
  const std::string shown = R"(visibleResults { results { identifier: "r" type: 5 } })";
  struct Row { const char* name; std::vector<std::string> in; std::string missingResults, missingSuggestions; };
  const Row rows[] = {
      {"shown twice, never delivered: missing once", {shown, shown}, R"(identifier: "1" type: 5)", ""},
      {"shown, then delivered", {shown, R"(resultsReceivedAfterTimeout { results { identifier: "r" type: 5 } })"}, "", ""},
      {"delivered, then shown", {R"(resultRanking { result { identifier: "r" type: 5 } })", shown}, "", ""},
      {"suggestion engaged, never shown",
       {R"(visibleSuggestions { suggestions { identifier: "s1" } })", R"(suggestionEngagement { suggestion { identifier: "s1" } })",
        R"(suggestionEngagement { suggestion { identifier: "s2" } })"},
       "", R"(identifier: "2")"},
      {"the first reference is kept (type 9 keeps titles)",
       {R"(resultGrading { result { identifier: "r" type: 9 title: "first" } })",
        R"(resultEngagement { result { identifier: "r" type: 9 title: "second" } })"},
       R"(identifier: "1" type: 9 title: "first")", ""},
      {"in the order of their numbers",
       {R"(visibleResults { results { identifier: "a" } results { identifier: "b" } results { identifier: "c" }
           results { identifier: "d" } results { identifier: "e" } results { identifier: "f" } results { identifier: "g" }
           results { identifier: "h" } results { identifier: "i" } results { identifier: "j" } results { identifier: "k" } })"},
       R"(identifier: "1" | identifier: "2" | identifier: "3" | identifier: "4" | identifier: "5" | identifier: "6" | )"
       R"(identifier: "7" | identifier: "8" | identifier: "9" | identifier: "10" | identifier: "11")", ""},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    SessionProcessingHelper helper;
    const auto payloads = processRow(helper, row.in);
    ASSERT_TRUE(helper.missingResults() && helper.missingSuggestions());
    EXPECT_EQ(join(*helper.missingResults()), row.missingResults);
    EXPECT_EQ(join(*helper.missingSuggestions()), row.missingSuggestions);
  }
}

// Guards against: a rewrite made to the wrong items or in the wrong order (rankings, sections, app codes).
TEST(Rewrites, EachKindRewrittenInPlace) {
  // Payloads and missing results as text; identifiers mapped/titles cleared.
  struct Row { const char* name; std::vector<std::string> in; std::string out, missing, counts; };
  const Row rows[] = {
      {"ranking",
       {R"(ranking { sections { results { result { identifier: "a1" } } section { results { items { identifier: "a2" } } } }
           sections { results { result { identifier: "b1" } } section { results { items { identifier: "b2" } } } }
           sections { section { results { items { identifier: "c2" } } } } })",
        R"(visibleResults { results { identifier: "a2" } results { identifier: "b2" } })"},
       R"(ranking { sections { results { result { identifier: "1" } } section { } } )"
       R"(sections { results { result { identifier: "3" } } section { } } )"
       R"(sections { section { results { items { identifier: "5" } } } } } | )"
       R"(visibleResults { results { identifier: "2" } results { identifier: "4" } })",
       "", "7/0"},
      {"result ranking and late sections",
       {R"(resultRanking { result { identifier: "m" } duplicateResults { identifier: "d" } hiddenResults { identifier: "h" } })",
        R"(lateSectionsAppended { sections { results { items { identifier: "x" } } } sections { results { items { identifier: "y" } } } })"},
       R"(resultRanking { result { identifier: "3" } duplicateResults { identifier: "1" } hiddenResults { identifier: "2" } } | )"
       R"(lateSectionsAppended { sections { results { items { identifier: "4" } } } sections { results { items { identifier: "5" } } } })",
       "", "5/0"},
      {"items anywhere: mapped and stripped, never missing",
       {R"(visibleSectionHeader { section { results { items { identifier: "a" type: 2 title: "t" } } } })",
        R"(sessionMissingResults { results { identifier: "b" type: 5 title: "t" } })",
        R"(sessionMissingSuggestions { suggestions { identifier: "c" } })",
        R"(visibleSectionHeader { section { results { items { identifier: "d" type: 9 title: "t" } } } })"},
       R"(visibleSectionHeader { section { results { items { identifier: "1" type: 2 } } } } | )"
       R"(sessionMissingResults { results { identifier: "2" type: 5 } } | )"
       R"(sessionMissingSuggestions { suggestions { identifier: "3" } } | )"
       R"(visibleSectionHeader { section { results { items { identifier: "4" type: 9 title: "t" } } } })",
       "", "4/2"},
      {"tapped section loses its results, still referenced",
       {R"(sectionEngagement { section { bundleIdentifier: "apps" results { items { identifier: "r" } } } triggerEvent: CV_TRIGGER_ENGAGEMENT_EVENT_TAP })"},
       R"(sectionEngagement { section { bundleIdentifier: "apps" } triggerEvent: CV_TRIGGER_ENGAGEMENT_EVENT_TAP })",
       R"(identifier: "1")", "1/0"},
      {"expanded section keeps its results, still referenced",
       {R"(sectionEngagement { section { results { items { identifier: "r" } } } triggerEvent: CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND })"},
       R"(sectionEngagement { section { results { items { identifier: "1" } } } triggerEvent: CV_TRIGGER_ENGAGEMENT_EVENT_EXPAND })",
       R"(identifier: "1")", "1/0"},
      {"local application codes",
       {R"(visibleResults { results { identifier: "a" type: 3 isLocalApplicationResult: true knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 }
           results { identifier: "b" type: 20 isLocalApplicationResult: true knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 }
           results { identifier: "c" type: 3 knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 } })"},
       R"(visibleResults { results { identifier: "1" type: 3 isLocalApplicationResult: true knownApplicationBundleIdentifier: 2 knownResultBundleId: 2 } )"
       R"(results { identifier: "2" type: 20 isLocalApplicationResult: true knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 } )"
       R"(results { identifier: "3" type: 3 knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 } })",
       R"(identifier: "1" type: 3 isLocalApplicationResult: true knownApplicationBundleIdentifier: 2 knownResultBundleId: 2 | )"
       R"(identifier: "2" type: 20 isLocalApplicationResult: true knownApplicationBundleIdentifier: 77 knownResultBundleId: 78 | )"
       R"(identifier: "3" type: 3 knownApplicationBundleIdentifier: 77 knownResultBundleId: 78)",
       "3/0"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    SessionProcessingHelper helper;
    const auto payloads = processRow(helper, row.in);
    EXPECT_EQ(join(payloads), row.out);
    EXPECT_EQ(join(*helper.missingResults()), row.missing);
    EXPECT_EQ(std::to_string(helper.identifiersMapped()) + "/" + std::to_string(helper.titlesCleared()), row.counts);
  }
}

// Guards against: a title or an unengaged-suggestion flag leaving for a result type that must not keep it.
TEST(EngagementRewrites, TitleKeptOnlyForTheEightListedTypes) {
  const std::set<int32_t> keeping = {9, 10, 11, 12, 13, 14, 18, 19};
  for (int32_t type = 0; type < 22; ++type) {
    auto engaged = pb<corevireon::CVResultEngagementFeedback>("titleText: \"t\" matchesUnengagedSuggestion: true result { type: " +
                                                              std::to_string(type) + " }");
    SessionProcessingHelper().process(&engaged);
    EXPECT_EQ(engaged.has_titletext(), keeping.count(type) == 1) << "type " << type;
    EXPECT_EQ(engaged.matchesunengagedsuggestion(), keeping.count(type) == 1) << "type " << type;
  }
  auto withoutResult = pb<corevireon::CVResultEngagementFeedback>(R"(titleText: "t")");
  SessionProcessingHelper().process(&withoutResult);
  EXPECT_FALSE(withoutResult.has_titletext());
}

// Guards against: query texts or punch-outs leaving for a result type other than 1, or redaction touching the title.
TEST(Redaction, ClearsQueryTextsAndPunchoutExceptForType1) {
  const std::string fields = R"(title: "t" userInput: "u" completedQuery: "c" intendedQuery: "i" punchout { name: "p" })";
  auto other = pb<CVSearchResultForFeedback>("type: 2 " + fields), typeOne = pb<CVSearchResultForFeedback>("type: 1 " + fields);
  redact(other);
  redact(typeOne);
  EXPECT_EQ(other.ShortDebugString(), R"(type: 2 title: "t")");
  EXPECT_EQ(typeOne.ShortDebugString(), pb<CVSearchResultForFeedback>("type: 1 " + fields).ShortDebugString());
}

}  // namespace
}  // namespace fbf::testing
