// Finding the read-only data files the search service ships.
//
// On Linux a resource "vireond/app-whitelist.json" is looked up under
// $XDG_DATA_HOME, then under each directory of $XDG_DATA_DIRS in order; the
// first that exists is used.
// Thread-safety: holds only its directory list; callable from any thread.
#pragma once

#include "platform/xdg.h"

#include <filesystem>
#include <optional>
#include <string_view>
#include <vector>

namespace fbf {

class ResourceLocator {
 public:
  virtual ~ResourceLocator() = default;
  // No value when no directory holds the resource.
  virtual std::optional<std::filesystem::path> pathToResource(
      std::string_view identifier) const = 0;
};

class XdgDataResourceLocator final : public ResourceLocator {
 public:
  explicit XdgDataResourceLocator(const XdgDirectories& dirs);
  std::optional<std::filesystem::path> pathToResource(std::string_view identifier) const override;

 private:
  std::vector<std::filesystem::path> searchPath_;
};

}  // namespace fbf
