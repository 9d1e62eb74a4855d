// What the whitelist tests share: a fixed list of installed applications and
// the resource document around an inner whitelist.
#pragma once

#include "whitelist/application_registry.h"

#include <nlohmann/json.hpp>

#include <string>
#include <vector>

namespace fbf::testing {

class FixedRegistry final : public ApplicationRegistry {
 public:
  std::vector<InstalledApplication> installedApplications() const override { return apps; }
  std::vector<InstalledApplication> apps;
};

inline InstalledApplication installed(std::string id) { return {std::move(id), std::string("1"), false}; }

// The outer document around an inner one; {bundle: [entries]} by default.
inline std::string document(const nlohmann::json& inner, const std::string& compression = "RLE",
                            const std::string& encoding = "bitmap") {
  return nlohmann::json{{"apps", inner.dump()}, {"compression", compression}, {"encoding", encoding}}.dump();
}
inline std::string whitelistDocument(const nlohmann::json& apps, const std::string& version = "0a1F") {
  return document({{"version", version}, {"apps", apps}});
}
// One entry carrying `id`, as the apps object wants it.
inline nlohmann::json entry(uint64_t id) { return nlohmann::json::array({{{"encoding_id", id}}}); }

}  // namespace fbf::testing
