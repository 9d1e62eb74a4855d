#include "whitelist/resource_locator.h"

namespace fbf {

XdgDataResourceLocator::XdgDataResourceLocator(const XdgDirectories& dirs) {
  searchPath_.push_back(dirs.dataHome);
  searchPath_.insert(searchPath_.end(), dirs.dataDirs.begin(), dirs.dataDirs.end());
}

std::optional<std::filesystem::path> XdgDataResourceLocator::pathToResource(
    std::string_view identifier) const {
  for (const auto& dir : searchPath_) {
    auto candidate = dir / std::filesystem::path(identifier);
    std::error_code ec;
    if (std::filesystem::exists(candidate, ec)) return candidate;
  }
  return std::nullopt;
}

}  // namespace fbf
