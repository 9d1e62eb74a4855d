#include "fbfctl/payload_json.h"

#include "corevireon.pb.h"

#include <google/protobuf/util/json_util.h>

#include <optional>

namespace fbf::fbfctl {
namespace {

// The message's protobuf JSON form, or no value when the bytes are not one.
std::optional<nlohmann::ordered_json> protobufJson(google::protobuf::Message& message,
                                                   const std::string& data) {
  if (!message.ParseFromString(data)) return std::nullopt;
  google::protobuf::util::JsonPrintOptions options;
  options.preserve_proto_field_names = true;
  std::string text;
  if (!google::protobuf::util::MessageToJsonString(message, &text, options).ok())
    return std::nullopt;
  return nlohmann::ordered_json::parse(text, nullptr, false);
}

nlohmann::ordered_json header(const std::string& format, const std::string& data) {
  nlohmann::ordered_json out;
  out["format"] = format;
  out["bytes"] = data.size();
  return out;
}

void putUndecoded(nlohmann::ordered_json& out, const std::string& data, const std::string& error) {
  if (!error.empty()) out["error"] = error;
  out["payloadBase64"] = base64(data);
}

}  // namespace

std::string base64(const std::string& bytes) {
  static constexpr char kAlphabet[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  out.reserve((bytes.size() + 2) / 3 * 4);
  size_t i = 0;
  auto byte = [&](size_t k) { return static_cast<uint32_t>(static_cast<unsigned char>(bytes[k])); };
  for (; i + 3 <= bytes.size(); i += 3) {
    uint32_t v = (byte(i) << 16) | (byte(i + 1) << 8) | byte(i + 2);
    for (int s = 18; s >= 0; s -= 6) out.push_back(kAlphabet[(v >> s) & 0x3f]);
  }
  size_t rest = bytes.size() - i;
  if (rest == 1) {
    uint32_t v = byte(i) << 16;
    out.push_back(kAlphabet[(v >> 18) & 0x3f]);
    out.push_back(kAlphabet[(v >> 12) & 0x3f]);
    out.append("==");
  } else if (rest == 2) {
    uint32_t v = (byte(i) << 16) | (byte(i + 1) << 8);
    out.push_back(kAlphabet[(v >> 18) & 0x3f]);
    out.push_back(kAlphabet[(v >> 12) & 0x3f]);
    out.push_back(kAlphabet[(v >> 6) & 0x3f]);
    out.push_back('=');
  }
  return out;
}

nlohmann::ordered_json describeUpload(const std::string& data, const std::string& format) {
  auto out = header(format, data);
  if (format == "FeedbackV2PB") {
    corevireon::CVClientSession session;
    if (auto json = protobufJson(session, data)) {
      out["payload"] = std::move(*json);
    } else {
      putUndecoded(out, data, "does not decode as a session");
    }
    return out;
  }
  if (format == "Usage") {
    corevireon::CVCohortsFeedback feedback;
    if (auto json = protobufJson(feedback, data)) {
      out["payload"] = std::move(*json);
    } else {
      putUndecoded(out, data, "does not decode as cohort feedback");
    }
    return out;
  }
  auto json = nlohmann::ordered_json::parse(data, nullptr, false);
  if (!json.is_discarded()) {
    out["payload"] = std::move(json);
  } else {
    putUndecoded(out, data, format == "FeedbackV2" ? "is not JSON" : "");
  }
  return out;
}

nlohmann::ordered_json describeCohortFeedback(const std::string& data) {
  auto out = header("cohorts", data);
  corevireon::CVUsageEnvelope envelope;
  if (auto json = protobufJson(envelope, data)) {
    out["payload"] = std::move(*json);
  } else {
    putUndecoded(out, data, "does not decode as a usage envelope");
  }
  return out;
}

}  // namespace fbf::fbfctl
