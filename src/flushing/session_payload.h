// The bytes a session file becomes on upload, before compression: decoded,
// rewritten by FlushableSession and serialised in the format the cached bag
// asks for. The flusher uploads exactly this and `fbfctl explain` shows
// exactly this, so the two cannot disagree about what leaves the device.
//
// Stateless; callable from any thread.
#pragma once

#include "assembly/configuration_bag.h"
#include "corevireon.pb.h"
#include "flushing/flushable_session.h"

#include <optional>
#include <string>
#include <string_view>

namespace fbf {

enum class SessionPayloadFormat {
  json,      // "FeedbackV2": generateSessionJSON() as compact JSON text
  protobuf,  // "FeedbackV2PB": the processed CVClientSession
};

// The bag's "vireon_feedback_format": protobuf when it is "FeedbackV2PB",
// JSON otherwise (also without a bag).
SessionPayloadFormat sessionPayloadFormat(const std::optional<ConfigurationBag>& bag);

// "FeedbackV2PB" or "FeedbackV2".
std::string_view sessionPayloadTypeString(SessionPayloadFormat format);

struct SessionPayload {
  enum class Outcome {
    ok,
    undecodable,  // the bytes are not a CVClientSession
    noFeedback,   // a session without feedback: nothing is uploaded
  };
  Outcome outcome = Outcome::ok;
  std::string bytes;  // the uncompressed upload when `ok`
  SessionRewriteSummary summary;
};

// Decodes `fileBytes` as a session, rewrites it (`postProcessFeedback` with
// `usageSink`, which may be null: a dry run counts no usage) and serialises
// it. Protobuf is written deterministically (a map's entries in key order),
// so the same file always yields the same bytes; JSON is
// `generateSessionJSON().dump()`.
SessionPayload makeSessionPayload(std::string_view fileBytes, SessionPayloadFormat format,
                                  UsageEventSink* usageSink);

// The processed session's protobuf bytes, deterministic as above. Anything
// that uploads a session in protobuf form serialises it with this.
std::string serializeSessionDeterministically(const corevireon::CVClientSession& session);

}  // namespace fbf
