// Capabilities that session processing attaches to the search service's
// feedback messages: identifiable items (results and suggestions carry an
// identifier and an item type), the redaction of a result's query texts, the
// list of results a feedback message carries, and the access to the
// `timestamp` that every feedback message has as field 1.
//
// The generated message classes cannot gain members, so each capability is a
// small value or free function that dispatches on the concrete message type.
// Everything here is stateless and callable from any thread; the handles do
// not own the messages they point into.
#pragma once

#include "corevireon.pb.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <variant>
#include <vector>

namespace fbf {

// A result or a suggestion whose identifier processing replaces. A handle:
// it points into a message owned elsewhere and must not outlive it.
class CVIdentifiable {
 public:
  explicit CVIdentifiable(corevireon::CVSearchResultForFeedback* result) : item_(result) {}
  explicit CVIdentifiable(corevireon::CVSearchSuggestionForFeedback* suggestion) : item_(suggestion) {}

  // The identifier, absent when the field is not set.
  std::optional<std::string> identifier() const;
  // Sets the identifier, or clears the field for an absent value.
  void setIdentifier(const std::optional<std::string>& identifier) const;
  // The item's own `type`.
  int32_t rType() const;

  // The underlying message; exactly one of the two is non-null.
  corevireon::CVSearchResultForFeedback* result() const;
  corevireon::CVSearchSuggestionForFeedback* suggestion() const;

 private:
  std::variant<corevireon::CVSearchResultForFeedback*, corevireon::CVSearchSuggestionForFeedback*> item_;
};

// Removes what the user typed and where the result leads from a result that
// is not of type 1: `userInput`, `completedQuery`, `intendedQuery` and
// `punchout` are cleared. A type 1 result is left as it is.
void redact(corevireon::CVSearchResultForFeedback& result);

// The results a feedback message carries, in this order:
//   visible results, results received after timeout: `results`;
//   section ranking: the results of its section;
//   result ranking: `duplicateResults`, `hiddenResults`, then `result`;
//   ranking: the section results of each of its section rankings, in order;
//   result engagement, result grading: `result`;
//   late sections appended: the results of every section;
//   section engagement: the results of its section;
//   anything else (and absent lists or messages): nothing.
// The pointers point into `feedback`.
std::vector<const corevireon::CVSearchResultForFeedback*> containedResults(
    const google::protobuf::Message& feedback);

// The feedback message a payload carries, or null when it carries none.
const google::protobuf::Message* codableMessage(const corevireon::CVFeedbackPayload& payload);
google::protobuf::Message* mutableCodableMessage(corevireon::CVFeedbackPayload& payload);

// `timestamp` (field 1) of the feedback message a payload carries; none
// when it carries none.
std::optional<uint64_t> codableTimestamp(const corevireon::CVFeedbackPayload& payload);

// What the rewrite's walks need to know of one message type, worked out once
// per type instead of looked up by name for every message of every session.
struct MessageShape {
  const google::protobuf::Descriptor* descriptor = nullptr;
  // Reflection of the generated class (null for a type outside the
  // generated pool); only valid for messages of that class.
  const google::protobuf::Reflection* generatedReflection = nullptr;
  // The fields that can hold messages (message fields, and maps whose values
  // are messages), with the shape of the message type they hold.
  std::vector<std::pair<const google::protobuf::FieldDescriptor*, const MessageShape*>> children;
  // `timestamp`, field 1, a single uint64; `titleText`, a single string;
  // `matchesUnengagedSuggestion`, a single bool: null where the type has none.
  const google::protobuf::FieldDescriptor* timestamp = nullptr;
  const google::protobuf::FieldDescriptor* titleText = nullptr;
  const google::protobuf::FieldDescriptor* matchesUnengagedSuggestion = nullptr;
  // The single fields holding a result, in declaration order.
  std::vector<const google::protobuf::FieldDescriptor*> singleResults;
};

const MessageShape& shapeOf(const google::protobuf::Descriptor* descriptor);

// Calls `visit` on `root` and then on every message set anywhere inside it,
// each parent before its children, found through the descriptors (so a
// message kind added to the .proto is walked without code here). `visit` may
// change the message it is given; the children walked are those present after
// it returns.
using MessageVisitor =
    std::function<void(google::protobuf::Message&, const google::protobuf::Reflection&, const MessageShape&)>;
void forEachMessage(google::protobuf::Message& root, const MessageVisitor& visit);

}  // namespace fbf
