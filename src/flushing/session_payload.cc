#include "flushing/session_payload.h"

#include "assembly/fbf_strings.h"

#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>

namespace fbf {

SessionPayloadFormat sessionPayloadFormat(const std::optional<ConfigurationBag>& bag) {
  return bag && bag->vireonFeedbackFormat() == FBFStrings::VireonProtobufFeedbackType ? SessionPayloadFormat::protobuf
                                                                                       : SessionPayloadFormat::json;
}

std::string_view sessionPayloadTypeString(SessionPayloadFormat format) {
  return format == SessionPayloadFormat::protobuf ? FBFStrings::VireonProtobufFeedbackType
                                                  : FBFStrings::VireonFeedbackType;
}

std::string serializeSessionDeterministically(const corevireon::CVClientSession& session) {
  std::string out;
  out.reserve(session.ByteSizeLong());
  {
    google::protobuf::io::StringOutputStream stream(&out);
    google::protobuf::io::CodedOutputStream coded(&stream);
    // Map entries otherwise come out in an order seeded per process.
    coded.SetSerializationDeterministic(true);
    session.SerializeWithCachedSizes(&coded);
  }
  return out;
}

SessionPayload makeSessionPayload(std::string_view fileBytes, SessionPayloadFormat format, UsageEventSink* usageSink) {
  SessionPayload payload;
  std::optional<FlushableSession> decoded = FlushableSession::decode(fileBytes);
  if (!decoded) {
    payload.outcome = SessionPayload::Outcome::undecodable;
    return payload;
  }
  FlushableSession& flushable = *decoded;
  if (!flushable.hasFeedback()) {
    payload.outcome = SessionPayload::Outcome::noFeedback;
    return payload;
  }
  flushable.postProcessFeedback(usageSink, &payload.summary);
  payload.bytes = format == SessionPayloadFormat::protobuf
                      ? serializeSessionDeterministically(flushable.backingStore())
                      : flushable.generateSessionJSON().dump();
  return payload;
}

}  // namespace fbf
