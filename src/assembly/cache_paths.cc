#include "assembly/cache_paths.h"

#include "assembly/fbf_strings.h"

namespace fbf {

std::optional<fs::path> cacheDirNoCreate(const FileManager& fm) {
  auto caches = fm.cachesDirectory();
  if (!caches) return std::nullopt;
  return *caches / FBFStrings::VireondReverseDomainIdentifier;
}

std::optional<fs::path> cachedBagURL(const FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) return std::nullopt;
  return *dir / FBFStrings::Paths::BagFilename;
}

std::optional<fs::path> customFeedbackDir(const FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) return std::nullopt;
  return *dir / FBFStrings::CustomFeedbackDirectory;
}

std::optional<fs::path> databaseURL(const FileManager& fm) {
  auto dir = cacheDirNoCreate(fm);
  if (!dir) return std::nullopt;
  return *dir / FBFStrings::CohortsModel / FBFStrings::CohortsDB;
}

}  // namespace fbf
