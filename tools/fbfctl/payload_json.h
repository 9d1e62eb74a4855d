// How `fbfctl tee` shows a payload: one JSON object per payload, decoded
// according to its format where the format is known.
#pragma once

#include <nlohmann/json.hpp>

#include <string>

namespace fbf::fbfctl {

// {"format": F, "bytes": N, "payload": ...}. Protobuf sessions ("FeedbackV2PB")
// and "Usage" cohort feedback become their protobuf JSON form; JSON payloads
// ("FeedbackV2" and JSON custom feedback) are embedded as they are; anything
// else, or a payload that does not decode as its format says, is given as
// "payloadBase64" (with "error" when it should have decoded).
nlohmann::ordered_json describeUpload(const std::string& data, const std::string& format);

// {"format": "cohorts", "bytes": N, "payload": <usage envelope>}.
nlohmann::ordered_json describeCohortFeedback(const std::string& data);

std::string base64(const std::string& bytes);

}  // namespace fbf::fbfctl
