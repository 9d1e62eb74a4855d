// The whitelist resource another program downloads: any bytes as the outer
// JSON document. Whatever signature comes out must list exactly the
// encoding ids of the installed, enabled applications the document names,
// as an independent reading of the document finds them.
#include "fuzz_check.h"
#include "platform/logging.h"
#include "whitelist/signature_decoder.h"
#include "whitelist/whitelist_format.h"

#include <nlohmann/json.hpp>

#include <algorithm>
#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace {

class FixedRegistry final : public fbf::ApplicationRegistry {
 public:
  std::vector<fbf::InstalledApplication> installedApplications() const override {
    std::vector<fbf::InstalledApplication> apps;
    for (int i = 0; i < 8; ++i) apps.push_back({"app" + std::to_string(i), "1.0", i % 2 == 0});
    apps.push_back({"noversion", std::nullopt, false});
    apps.push_back({"", "2.0", false});
    return apps;
  }
};

const std::set<std::string> kDisabled = {"app3"};

// The ids the signature must carry, read without the code under test.
std::optional<std::vector<uint64_t>> expectedIds(std::string_view document) {
  auto outer = nlohmann::json::parse(document, nullptr, false);
  if (outer.is_discarded() || !outer.is_object()) return std::nullopt;
  auto apps = outer.find("apps");
  if (apps == outer.end() || !apps->is_string()) return std::nullopt;
  auto inner = nlohmann::json::parse(apps->get<std::string>(), nullptr, false);
  if (inner.is_discarded() || !inner.is_object() || !inner.contains("apps") || !inner["apps"].is_object())
    return std::nullopt;
  std::vector<uint64_t> ids;
  for (int i = 0; i < 8; ++i) {
    std::string name = "app" + std::to_string(i);
    if (kDisabled.count(name)) continue;
    const auto& list = inner["apps"];
    if (!list.contains(name) || !list[name].is_array() || list[name].empty()) continue;
    const auto& last = list[name].back();
    if (last.is_object() && last.contains("encoding_id") && last["encoding_id"].is_number_unsigned())
      ids.push_back(last["encoding_id"].get<uint64_t>());
  }
  std::sort(ids.begin(), ids.end());
  return ids;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string_view document(reinterpret_cast<const char*>(data), size);
  FixedRegistry registry;
  auto expected = expectedIds(document);
  // Ids past the record's 16-bit length fields stop the process by design
  // (a broken resource package); that is not what this harness looks for.
  if (expected && !expected->empty() && expected->back() / 8 + 1 + 4 >= fbf::kPayloadLengthLimit) return 0;

  fbf::WhitelistFailure failure{};
  auto signature = fbf::processWhitelist(document, kDisabled, registry, &failure);
  if (!signature) {
    if (failure == fbf::WhitelistFailure::noWhitelistedApplications)
      FUZZ_CHECK(expected && expected->empty(), "no applications found, but the document names some");
    return 0;
  }
  FUZZ_CHECK(expected.has_value(), "a signature from a document that is no whitelist");
  std::string why;
  auto decoded = fbf::testing::decodeSignature(*signature, &why);
  FUZZ_CHECK(decoded.has_value(), "the signature does not decode: %s", why.c_str());
  std::vector<uint64_t> unique = *expected;
  unique.erase(std::unique(unique.begin(), unique.end()), unique.end());
  FUZZ_CHECK(decoded->bitmap == fbf::testing::bitmapOf(unique), "the signature lists other applications");
  return 0;
}
