#include "flushing/session_processing_helper.h"

#include "flushing/message_cast.h"

#include <algorithm>
#include <array>

namespace fbf {

using corevireon::CVSearchResultForFeedback;
using corevireon::CVSearchSuggestionForFeedback;
using google::protobuf::FieldDescriptor;

namespace {

// Result types whose engagement keeps the title the user saw.
constexpr std::array<int32_t, 8> kTitleKeepingResultTypes = {9, 10, 11, 12, 13, 14, 18, 19};

constexpr int32_t kLocalApplicationExemptType = 20;
constexpr int32_t kLocalApplicationBundleCode = 2;
constexpr int32_t kTriggerEventExpand = 2;

using Items = std::vector<CVIdentifiable>;

void addResults(Items& items, google::protobuf::RepeatedPtrField<CVSearchResultForFeedback>* list) {
  for (auto& r : *list) items.emplace_back(&r);
}

void addSectionResults(Items& items, corevireon::CVResultSection* section) {
  if (section->has_results()) addResults(items, section->mutable_results()->mutable_items());
}

}  // namespace

std::optional<std::string> SessionProcessingHelper::replacementForIdentifier(
    const std::optional<std::string>& identifier, int32_t rType) {
  if (!identifier || identifier->empty()) return std::nullopt;
  std::string key = *identifier + std::to_string(rType);
  if (auto it = idMapping_.find(key); it != idMapping_.end()) return it->second;
  std::string replacement = std::to_string(nextMappedId_);
  ++nextMappedId_;
  idMapping_.emplace(std::move(key), replacement);
  allIdSet_.insert(replacement);
  return replacement;
}

void SessionProcessingHelper::didReference(const std::optional<CVIdentifiable>& item) {
  if (!item) return;
  auto id = item->identifier();
  if (!id || id->empty()) return;
  if (expandedIdSet_.count(*id) != 0) return;
  if (identifiableMapping_.count(*id) != 0) return;
  if (auto* r = item->result()) {
    identifiableMapping_.emplace(*id, Item(std::in_place_type<CVSearchResultForFeedback>, *r));
  } else {
    identifiableMapping_.emplace(*id, Item(std::in_place_type<CVSearchSuggestionForFeedback>, *item->suggestion()));
  }
}

void SessionProcessingHelper::didExpand(const std::optional<CVIdentifiable>& item) {
  if (!item) return;
  auto id = item->identifier();
  if (!id || id->empty()) return;
  expandedIdSet_.insert(*id);
  identifiableMapping_.erase(*id);
}

bool SessionProcessingHelper::keepsTitle(int32_t resultType) {
  return std::find(kTitleKeepingResultTypes.begin(), kTitleKeepingResultTypes.end(), resultType) !=
         kTitleKeepingResultTypes.end();
}

void SessionProcessingHelper::rewriteItem(const CVIdentifiable& item) {
  auto identifier = item.identifier();
  if (identifier && !identifier->empty()) ++identifiersMapped_;
  item.setIdentifier(replacementForIdentifier(identifier, item.rType()));
  // Rewritten before the bookkeeping so that the copy kept for the missing
  // list is what the uploaded item is.
  if (auto* r = item.result()) {
    if (r->islocalapplicationresult() && r->type() != kLocalApplicationExemptType) {
      r->set_knownapplicationbundleidentifier(kLocalApplicationBundleCode);
      r->set_knownresultbundleid(kLocalApplicationBundleCode);
    }
    if (r->has_title() && !keepsTitle(r->type())) {
      r->clear_title();
      ++titlesCleared_;
    }
    rewritten_.insert(r);
  } else {
    rewritten_.insert(item.suggestion());
  }
}

void SessionProcessingHelper::processItems(const Items& items, bool expanded) {
  for (const CVIdentifiable& item : items) {
    rewriteItem(item);
    expanded ? didExpand(item) : didReference(item);
  }
}

void SessionProcessingHelper::applyTitleRule(google::protobuf::Message& message,
                                             const google::protobuf::Reflection& reflection,
                                             const MessageShape& shape) {
  if (shape.titleText == nullptr) return;
  // The title the user saw stays only when the engaged result is of a type
  // whose titles are not personal.
  for (const FieldDescriptor* f : shape.singleResults) {
    if (!reflection.HasField(message, f)) continue;
    if (keepsTitle(static_cast<const CVSearchResultForFeedback&>(reflection.GetMessage(message, f)).type())) return;
    break;
  }
  if (reflection.HasField(message, shape.titleText)) {
    reflection.ClearField(&message, shape.titleText);
    ++titlesCleared_;
  }
  if (shape.matchesUnengagedSuggestion != nullptr) reflection.SetBool(&message, shape.matchesUnengagedSuggestion, false);
}

void SessionProcessingHelper::process(google::protobuf::Message* feedback) {
  if (feedback == nullptr) return;
  const bool outermost = depth_++ == 0;
  processKnownKind(feedback);
  if (outermost) {
    // Whatever the table above does not reach (a section header's results, a
    // kind added to the .proto later) is still mapped and stripped, without
    // bookkeeping: the table alone decides what counts as shown or delivered.
    forEachMessage(*feedback, [this](google::protobuf::Message& m, const google::protobuf::Reflection& reflection,
                                     const MessageShape& shape) {
      if (auto* r = messageAs<CVSearchResultForFeedback>(m)) {
        if (!rewritten_.count(r)) rewriteItem(CVIdentifiable(r));
      } else if (auto* s = messageAs<CVSearchSuggestionForFeedback>(m)) {
        if (!rewritten_.count(s)) rewriteItem(CVIdentifiable(s));
      } else {
        applyTitleRule(m, reflection, shape);
      }
    });
    rewritten_.clear();
  }
  --depth_;
}

void SessionProcessingHelper::processKnownKind(google::protobuf::Message* feedback) {
  Items items;

  if (auto* m = messageAs<corevireon::CVVisibleResultsFeedback>(*feedback)) {
    addResults(items, m->mutable_results());
    processItems(items, false);
  } else if (auto* m = messageAs<corevireon::CVVisibleSuggestionsFeedback>(*feedback)) {
    for (auto& s : *m->mutable_suggestions()) items.emplace_back(&s);
    processItems(items, true);
  } else if (auto* m = messageAs<corevireon::CVSuggestionEngagementFeedback>(*feedback)) {
    if (m->has_suggestion()) items.emplace_back(m->mutable_suggestion());
    processItems(items, false);
  } else if (auto* m = messageAs<corevireon::CVResultsReceivedAfterTimeoutFeedback>(*feedback)) {
    addResults(items, m->mutable_results());
    processItems(items, true);
  } else if (auto* m = messageAs<corevireon::CVSectionRankingFeedback>(*feedback)) {
    for (auto& resultRanking : *m->mutable_results()) process(&resultRanking);
    if (m->has_section()) addSectionResults(items, m->mutable_section());
    processItems(items, true);
    if (m->results_size() > 0 && m->has_section()) m->mutable_section()->clear_results();
  } else if (auto* m = messageAs<corevireon::CVResultRankingFeedback>(*feedback)) {
    addResults(items, m->mutable_duplicateresults());
    addResults(items, m->mutable_hiddenresults());
    if (m->has_result()) items.emplace_back(m->mutable_result());
    processItems(items, true);
  } else if (auto* m = messageAs<corevireon::CVRankingFeedback>(*feedback)) {
    for (auto& sectionRanking : *m->mutable_sections()) process(&sectionRanking);
  } else if (auto* m = messageAs<corevireon::CVResultEngagementFeedback>(*feedback)) {
    if (m->has_result()) items.emplace_back(m->mutable_result());
    processItems(items, false);
  } else if (auto* m = messageAs<corevireon::CVResultGradingFeedback>(*feedback)) {
    if (m->has_result()) items.emplace_back(m->mutable_result());
    processItems(items, false);
  } else if (auto* m = messageAs<corevireon::CVLateSectionsAppendedFeedback>(*feedback)) {
    for (auto& section : *m->mutable_sections()) addSectionResults(items, &section);
    processItems(items, true);
  } else if (auto* m = messageAs<corevireon::CVSectionEngagementFeedback>(*feedback)) {
    if (m->has_section()) addSectionResults(items, m->mutable_section());
    processItems(items, false);
    if (m->triggerevent() != kTriggerEventExpand && m->has_section()) m->mutable_section()->clear_results();
  }
}

std::optional<std::vector<CVSearchResultForFeedback>> SessionProcessingHelper::missingResults() const {
  std::vector<CVSearchResultForFeedback> out;
  for (const auto& [id, item] : identifiableMapping_) {
    if (auto* r = std::get_if<CVSearchResultForFeedback>(&item)) out.push_back(*r);
  }
  return out;
}

std::optional<std::vector<CVSearchSuggestionForFeedback>> SessionProcessingHelper::missingSuggestions() const {
  std::vector<CVSearchSuggestionForFeedback> out;
  for (const auto& [id, item] : identifiableMapping_) {
    if (auto* s = std::get_if<CVSearchSuggestionForFeedback>(&item)) out.push_back(*s);
  }
  return out;
}

std::vector<CVSearchResultForFeedback> SessionProcessingHelper::takeMissingResults() {
  std::vector<CVSearchResultForFeedback> out;
  for (auto it = identifiableMapping_.begin(); it != identifiableMapping_.end();) {
    if (auto* r = std::get_if<CVSearchResultForFeedback>(&it->second)) {
      out.push_back(std::move(*r));
      it = identifiableMapping_.erase(it);
    } else {
      ++it;
    }
  }
  return out;
}

std::vector<CVSearchSuggestionForFeedback> SessionProcessingHelper::takeMissingSuggestions() {
  std::vector<CVSearchSuggestionForFeedback> out;
  for (auto it = identifiableMapping_.begin(); it != identifiableMapping_.end();) {
    if (auto* s = std::get_if<CVSearchSuggestionForFeedback>(&it->second)) {
      out.push_back(std::move(*s));
      it = identifiableMapping_.erase(it);
    } else {
      ++it;
    }
  }
  return out;
}

}  // namespace fbf
