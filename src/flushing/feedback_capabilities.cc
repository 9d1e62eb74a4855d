#include "flushing/feedback_capabilities.h"

#include "flushing/message_cast.h"

#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

namespace fbf {

using corevireon::CVSearchResultForFeedback;
using corevireon::CVSearchSuggestionForFeedback;
using google::protobuf::Descriptor;
using google::protobuf::DescriptorPool;
using google::protobuf::FieldDescriptor;
using google::protobuf::Message;
using google::protobuf::MessageFactory;
using google::protobuf::Reflection;

std::optional<std::string> CVIdentifiable::identifier() const {
  if (auto* r = result()) return r->has_identifier() ? std::optional(r->identifier()) : std::nullopt;
  auto* s = suggestion();
  return s->has_identifier() ? std::optional(s->identifier()) : std::nullopt;
}

void CVIdentifiable::setIdentifier(const std::optional<std::string>& identifier) const {
  if (auto* r = result()) {
    identifier ? r->set_identifier(*identifier) : r->clear_identifier();
    return;
  }
  auto* s = suggestion();
  identifier ? s->set_identifier(*identifier) : s->clear_identifier();
}

int32_t CVIdentifiable::rType() const {
  if (auto* r = result()) return r->type();
  return suggestion()->type();
}

CVSearchResultForFeedback* CVIdentifiable::result() const {
  auto* p = std::get_if<CVSearchResultForFeedback*>(&item_);
  return p ? *p : nullptr;
}

CVSearchSuggestionForFeedback* CVIdentifiable::suggestion() const {
  auto* p = std::get_if<CVSearchSuggestionForFeedback*>(&item_);
  return p ? *p : nullptr;
}

void redact(CVSearchResultForFeedback& result) {
  if (result.type() == 1) return;
  result.clear_userinput();
  result.clear_completedquery();
  result.clear_intendedquery();
  result.clear_punchout();
}

namespace {

using Results = std::vector<const CVSearchResultForFeedback*>;

void appendAll(Results& out, const google::protobuf::RepeatedPtrField<CVSearchResultForFeedback>& list) {
  for (const auto& r : list) out.push_back(&r);
}

void appendSection(Results& out, const corevireon::CVResultSection& section) {
  if (section.has_results()) appendAll(out, section.results().items());
}

}  // namespace

Results containedResults(const Message& feedback) {
  Results out;
  if (auto* m = messageAs<corevireon::CVVisibleResultsFeedback>(feedback)) {
    appendAll(out, m->results());
  } else if (auto* m = messageAs<corevireon::CVResultsReceivedAfterTimeoutFeedback>(feedback)) {
    appendAll(out, m->results());
  } else if (auto* m = messageAs<corevireon::CVSectionRankingFeedback>(feedback)) {
    if (m->has_section()) appendSection(out, m->section());
  } else if (auto* m = messageAs<corevireon::CVResultRankingFeedback>(feedback)) {
    appendAll(out, m->duplicateresults());
    appendAll(out, m->hiddenresults());
    if (m->has_result()) out.push_back(&m->result());
  } else if (auto* m = messageAs<corevireon::CVRankingFeedback>(feedback)) {
    for (const auto& sectionRanking : m->sections()) {
      if (sectionRanking.has_section()) appendSection(out, sectionRanking.section());
    }
  } else if (auto* m = messageAs<corevireon::CVResultEngagementFeedback>(feedback)) {
    if (m->has_result()) out.push_back(&m->result());
  } else if (auto* m = messageAs<corevireon::CVResultGradingFeedback>(feedback)) {
    if (m->has_result()) out.push_back(&m->result());
  } else if (auto* m = messageAs<corevireon::CVLateSectionsAppendedFeedback>(feedback)) {
    for (const auto& section : m->sections()) appendSection(out, section);
  } else if (auto* m = messageAs<corevireon::CVSectionEngagementFeedback>(feedback)) {
    if (m->has_section()) appendSection(out, m->section());
  }
  return out;
}

namespace {

// The payload's oneof by case number, worked out once, with the shape of the
// message each case holds. Every session's payloads go through here several
// times, and asking a generated message for its descriptor or reflection
// takes protobuf's once-only path (a std::call_once with its thread-locals)
// on each call.
struct CodableTable {
  const Reflection* payloadReflection = nullptr;
  std::vector<std::pair<const FieldDescriptor*, const MessageShape*>> byCase;
  const std::pair<const FieldDescriptor*, const MessageShape*>* find(int codableCase) const {
    if (codableCase <= 0 || static_cast<size_t>(codableCase) >= byCase.size()) return nullptr;
    const auto& entry = byCase[static_cast<size_t>(codableCase)];
    return entry.first ? &entry : nullptr;
  }
};

const CodableTable& codableTable() {
  static const CodableTable table = [] {
    CodableTable t;
    t.payloadReflection = corevireon::CVFeedbackPayload::GetReflection();
    const auto* oneof = corevireon::CVFeedbackPayload::descriptor()->FindOneofByName("codable");
    for (int i = 0; oneof != nullptr && i < oneof->field_count(); ++i) {
      const FieldDescriptor* field = oneof->field(i);
      if (field->cpp_type() != FieldDescriptor::CPPTYPE_MESSAGE) continue;
      const auto number = static_cast<size_t>(field->number());
      if (number >= t.byCase.size()) t.byCase.resize(number + 1);
      t.byCase[number] = {field, &shapeOf(field->message_type())};
    }
    return t;
  }();
  return table;
}

}  // namespace

const Message* codableMessage(const corevireon::CVFeedbackPayload& payload) {
  const auto* entry = codableTable().find(payload.codable_case());
  return entry ? &codableTable().payloadReflection->GetMessage(payload, entry->first) : nullptr;
}

Message* mutableCodableMessage(corevireon::CVFeedbackPayload& payload) {
  const auto* entry = codableTable().find(payload.codable_case());
  return entry ? codableTable().payloadReflection->MutableMessage(&payload, entry->first) : nullptr;
}

std::optional<uint64_t> codableTimestamp(const corevireon::CVFeedbackPayload& payload) {
  const auto* entry = codableTable().find(payload.codable_case());
  if (entry == nullptr) return std::nullopt;
  const MessageShape& shape = *entry->second;
  if (shape.timestamp == nullptr || shape.generatedReflection == nullptr) return std::nullopt;
  const Message& message = codableTable().payloadReflection->GetMessage(payload, entry->first);
  return shape.generatedReflection->GetUInt64(message, shape.timestamp);
}

namespace {

MessageShape& buildShape(std::unordered_map<const Descriptor*, std::unique_ptr<MessageShape>>& shapes,
                         const Descriptor* descriptor) {
  auto [it, added] = shapes.try_emplace(descriptor);
  if (!added) return *it->second;  // done, or being built further up (a recursive type)
  it->second = std::make_unique<MessageShape>();
  MessageShape& shape = *it->second;
  shape.descriptor = descriptor;
  if (descriptor->file()->pool() == DescriptorPool::generated_pool()) {
    if (const Message* prototype = MessageFactory::generated_factory()->GetPrototype(descriptor)) {
      shape.generatedReflection = prototype->GetReflection();
    }
  }
  for (int i = 0, n = descriptor->field_count(); i < n; ++i) {
    const FieldDescriptor* field = descriptor->field(i);
    const bool single = !field->is_repeated();
    if (field->cpp_type() == FieldDescriptor::CPPTYPE_MESSAGE) {
      if (field->is_map() && field->message_type()->map_value()->cpp_type() != FieldDescriptor::CPPTYPE_MESSAGE) {
        continue;  // scalar maps hold nothing to walk
      }
      shape.children.emplace_back(field, &buildShape(shapes, field->message_type()));
      if (single && field->message_type() == CVSearchResultForFeedback::descriptor()) {
        shape.singleResults.push_back(field);
      }
    } else if (single && field->number() == 1 && field->name() == "timestamp" &&
               field->cpp_type() == FieldDescriptor::CPPTYPE_UINT64) {
      shape.timestamp = field;
    } else if (single && field->name() == "titleText" && field->cpp_type() == FieldDescriptor::CPPTYPE_STRING) {
      shape.titleText = field;
    } else if (single && field->name() == "matchesUnengagedSuggestion" &&
               field->cpp_type() == FieldDescriptor::CPPTYPE_BOOL) {
      shape.matchesUnengagedSuggestion = field;
    }
  }
  return shape;
}

// Below a generated message every message is generated too, so the cached
// reflection serves; otherwise each message is asked for its own.
void walk(Message& message, const Reflection& reflection, const MessageShape& shape, bool generated,
          const MessageVisitor& visit) {
  visit(message, reflection, shape);
  for (const auto& [field, childShape] : shape.children) {
    const Reflection* cached = generated ? childShape->generatedReflection : nullptr;
    if (field->is_repeated()) {
      for (int j = 0, count = reflection.FieldSize(message, field); j < count; ++j) {
        Message& child = *reflection.MutableRepeatedMessage(&message, field, j);
        walk(child, cached ? *cached : *child.GetReflection(), *childShape, generated, visit);
      }
    } else if (reflection.HasField(message, field)) {
      Message& child = *reflection.MutableMessage(&message, field);
      walk(child, cached ? *cached : *child.GetReflection(), *childShape, generated, visit);
    }
  }
}

}  // namespace

const MessageShape& shapeOf(const Descriptor* descriptor) {
  static std::mutex mutex;
  static std::unordered_map<const Descriptor*, std::unique_ptr<MessageShape>> shapes;
  std::lock_guard lock(mutex);
  return buildShape(shapes, descriptor);
}

void forEachMessage(Message& root, const MessageVisitor& visit) {
  const MessageShape& shape = shapeOf(root.GetDescriptor());
  const Reflection* reflection = root.GetReflection();
  walk(root, *reflection, shape, reflection == shape.generatedReflection, visit);
}

}  // namespace fbf
