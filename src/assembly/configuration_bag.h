// The cached configuration bag: a property list downloaded by the search
// daemon into its cache directory. This daemon only reads it, as it is at
// every access (through `ConfigurationBagCache`, which parses it again only
// when it changed). A file that is not a dictionary property list is no bag.
#pragma once

#include "platform/file_manager.h"
#include "platform/file_stamp.h"
#include "platform/property_list.h"

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>

namespace fbf {

class ConfigurationBag {
 public:
  // No value (and one error line saying why) when the file cannot be read or
  // is not a dictionary property list.
  static std::optional<ConfigurationBag> fromFile(const fs::path& path, const FileManager& fileManager);
  explicit ConfigurationBag(PropertyList values) : values_(std::move(values)) {}

  std::optional<std::string> feedbackURL() const;
  std::optional<std::string> crowdsourcingURL() const;
  std::optional<int64_t> feedbackMaxAgeInDays() const;
  // Type name to size limit in bytes; entries that are not non-negative
  // integers are left out.
  std::map<std::string, uint64_t> maxCustomFeedbackSizes() const;
  std::optional<std::string> vireonFeedbackFormat() const;
  std::optional<int64_t> cohortsLookbackInDays() const;

  const PropertyList& values() const { return values_; }

 private:
  std::optional<std::string> string(std::string_view key) const;
  std::optional<int64_t> integer(std::string_view key) const;
  PropertyList values_;
};

// The bag of one path as it is now, parsed again only when the file's stamp
// changed: one stat(2) per access. Thread-safe.
class ConfigurationBagCache {
 public:
  std::optional<ConfigurationBag> read(const fs::path& path, const FileManager& fileManager);

 private:
  std::mutex mutex_;
  bool valid_ = false;
  fs::path path_;
  FileStamp stamp_;
  std::optional<ConfigurationBag> bag_;
};

}  // namespace fbf
