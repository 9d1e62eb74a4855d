// The bag and the preference files: any bytes through the property-list
// reader (XML or binary). Whatever parses must survive a round trip through
// both writers unchanged, and the bag's accessors must answer for any value.
#include "assembly/configuration_bag.h"
#include "assembly/fbf_strings.h"
#include "fuzz_check.h"
#include "platform/logging.h"
#include "platform/property_list.h"

#include <cstdint>
#include <string_view>

namespace {

// The XML writer prints -0.0 as 0.0; the sign of a zero means nothing here.
fbf::PropertyList withoutNegativeZero(fbf::PropertyList value) {
  if (value.is_number_float() && value.get<double>() == 0.0) return 0.0;
  if (value.is_structured()) {
    for (auto& element : value) element = withoutNegativeZero(element);
  }
  return value;
}

std::string canonical(const fbf::PropertyList& value) {
  // NaN is not equal to itself; its text is.
  return withoutNegativeZero(value).dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string_view bytes(reinterpret_cast<const char*>(data), size);
  std::string error;
  auto value = fbf::parsePropertyList(bytes, &error);
  if (!value) {
    FUZZ_CHECK(!error.empty(), "a rejected property list must say why");
    return 0;
  }
  for (auto format : {fbf::PropertyListFormat::xml, fbf::PropertyListFormat::binary}) {
    std::string written = fbf::serializePropertyList(*value, format);
    std::string again;
    auto reread = fbf::parsePropertyList(written, &again);
    FUZZ_CHECK(reread.has_value(), "our own %s output does not parse: %s",
               format == fbf::PropertyListFormat::xml ? "XML" : "binary", again.c_str());
    FUZZ_CHECK(canonical(*reread) == canonical(*value), "%s round trip changed the value: %s -> %s",
               format == fbf::PropertyListFormat::xml ? "XML" : "binary", canonical(*value).c_str(),
               canonical(*reread).c_str());
  }
  if (value->is_object()) {
    fbf::ConfigurationBag bag(*value);
    (void)bag.feedbackURL();
    (void)bag.crowdsourcingURL();
    (void)bag.feedbackMaxAgeInDays();
    (void)bag.vireonFeedbackFormat();
    (void)bag.cohortsLookbackInDays();
    for (const auto& [type, limit] : bag.maxCustomFeedbackSizes()) {
      FUZZ_CHECK(value->at(fbf::FBFStrings::Defaults::MaxFeedbackSizes).contains(type), "limit for a type the bag does not name");
      (void)limit;
    }
  }
  return 0;
}
