// Replaces the result and suggestion identifiers of one session's feedback by
// small session-local numbers and notes which items the session only
// referenced (showed, engaged, graded) without ever delivering them in full.
//
// One helper per session: the flushable session feeds it every feedback
// message in timestamp order, then reads `missingResults` and
// `missingSuggestions`. Numbering starts at 1 for every helper, so a
// replacement means something only within its session. Not thread-safe; it
// lives on the work queue for the processing of one session.
//
// Rules, per feedback message (the first matching kind decides which items
// count as referenced or expanded):
//   visible results .............. `results` ............................ referenced
//   visible suggestions .......... `suggestions` ........................ expanded
//   suggestion engagement ........ `suggestion` ......................... referenced
//   results received after timeout `results` ............................ expanded
//   section ranking .............. each result ranking is processed as its own
//                                  feedback first, then the section's `results` expanded
//   result ranking ............... `duplicateResults`, `hiddenResults`, `result` expanded
//   ranking ...................... each section ranking processed in turn
//   result engagement ............ `result` ............................. referenced
//   result grading ............... `result` ............................. referenced
//   late sections appended ....... every section's `results` ............ expanded
//   section engagement ........... the section's `results` .............. referenced
// Then every result and suggestion anywhere else inside the feedback message
// (a section header's section, a kind this table does not know) is found
// through the descriptors and rewritten the same way, without bookkeeping.
// Rewrites of every result and suggestion:
//   * the identifier is replaced (`replacementForIdentifier`);
//   * a result's `title` is cleared unless its type is 9, 10, 11, 12, 13, 14,
//     18 or 19 (the title rule);
//   * a local-application result whose type is not 20 gets the bundle codes
//     `knownApplicationBundleIdentifier` and `knownResultBundleId` set to 2.
// Rewrites of feedback messages:
//   * any message with a `titleText` (result engagement): unless its result
//     is of one of the eight types above, `titleText` is cleared and
//     `matchesUnengagedSuggestion` set to false;
//   * section ranking with result rankings: the section's `results` are
//     cleared once gathered;
//   * section engagement whose trigger event is not 2 (expand): the section's
//     `results` are cleared once gathered (they still count as referenced).
#pragma once

#include "corevireon.pb.h"
#include "flushing/feedback_capabilities.h"

#include <cstdint>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <variant>
#include <vector>

namespace fbf {

class SessionProcessingHelper {
 public:
  SessionProcessingHelper() = default;

  // Maps and records the items of one feedback message, rewriting it in
  // place. Null does nothing.
  void process(google::protobuf::Message* feedback);

  // The session-local replacement of an identifier under an item type: the
  // decimal strings "1", "2", ... in order of first appearance of the key
  // (identifier immediately followed by the decimal type, no separator, so
  // "ab" with type 17 and "ab1" with type 7 share one replacement). Absent or
  // empty identifiers yield absent and use up no number.
  std::optional<std::string> replacementForIdentifier(const std::optional<std::string>& identifier,
                                                      int32_t rType);

  // Bookkeeping by replacement identifier. An item referenced before it is
  // expanded is not missing; one referenced after its expansion is never
  // recorded; of several references the first is kept.
  void didReference(const std::optional<CVIdentifiable>& item);
  void didExpand(const std::optional<CVIdentifiable>& item);

  // Items referenced but never expanded, in the order of their replacement
  // numbers; empty when there are none.
  std::optional<std::vector<corevireon::CVSearchResultForFeedback>> missingResults() const;
  std::optional<std::vector<corevireon::CVSearchSuggestionForFeedback>> missingSuggestions() const;
  // The same lists, moved out of the helper (which then has none): for the
  // one reader that consumes them, without copying every item again.
  std::vector<corevireon::CVSearchResultForFeedback> takeMissingResults();
  std::vector<corevireon::CVSearchSuggestionForFeedback> takeMissingSuggestions();

  int64_t nextMappedId() const { return nextMappedId_; }
  const std::set<std::string>& allIdSet() const { return allIdSet_; }
  const std::set<std::string>& expandedIdSet() const { return expandedIdSet_; }

  // What the rewrites did so far: identifiers replaced (absent and empty ones
  // do not count) and titles cleared (result titles and engagement titles).
  uint64_t identifiersMapped() const { return identifiersMapped_; }
  uint64_t titlesCleared() const { return titlesCleared_; }

  // Whether a result of this type keeps its title on upload.
  static bool keepsTitle(int32_t resultType);

 private:
  // Orders decimal strings by value ("2" before "10").
  struct ByNumericValue {
    bool operator()(const std::string& a, const std::string& b) const {
      return a.size() != b.size() ? a.size() < b.size() : a < b;
    }
  };
  // A copy of a referenced item as it stands after its rewrites; the original
  // may be removed from its feedback later (cleared section results).
  using Item = std::variant<corevireon::CVSearchResultForFeedback, corevireon::CVSearchSuggestionForFeedback>;

  void processKnownKind(google::protobuf::Message* feedback);
  void processItems(const std::vector<CVIdentifiable>& items, bool expanded);
  void rewriteItem(const CVIdentifiable& item);
  void applyTitleRule(google::protobuf::Message& message, const google::protobuf::Reflection& reflection,
                      const MessageShape& shape);

  int64_t nextMappedId_ = 1;
  std::unordered_map<std::string, std::string> idMapping_;
  std::map<std::string, Item, ByNumericValue> identifiableMapping_;
  std::set<std::string> expandedIdSet_;
  std::set<std::string> allIdSet_;
  // Items already rewritten during the current outermost `process` call, so
  // the descriptor walk does not map an identifier twice.
  std::unordered_set<const google::protobuf::Message*> rewritten_;
  int depth_ = 0;
  uint64_t identifiersMapped_ = 0;
  uint64_t titlesCleared_ = 0;
};

}  // namespace fbf
