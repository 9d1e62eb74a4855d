// The user-defaults store: one property-list file per preferences domain.
//
// Every read sees the file as it is now, so a change made by `fbfctl defaults
// write` (or by hand) takes effect at the next read. The file is parsed again
// only when it has changed: each read costs one stat(2), compared against the
// identity (device, inode), size and change times of the file last parsed
// (lstat: a preferences file is never read through a symbolic link).
// A missing file means no values; a malformed one means no values plus one
// error line each time it changes.
// Writes go through a temporary file and a rename, owner-only.
// Thread-safety: callable from any thread; concurrent writers of the same
// domain race as whole-file replacements (last writer wins).
#pragma once

#include "platform/file_manager.h"
#include "platform/property_list.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace fbf {

class UserDefaults {
 public:
  virtual ~UserDefaults() = default;
  virtual const std::string& domain() const = 0;

  // The whole domain as a dictionary (empty when missing or malformed).
  virtual PropertyList dictionaryRepresentation() const = 0;
  // The same, shared rather than copied: what the typed getters read.
  virtual std::shared_ptr<const PropertyList> snapshot() const {
    return std::make_shared<const PropertyList>(dictionaryRepresentation());
  }
  virtual bool setObject(std::string_view key, const PropertyList& value) = 0;
  virtual bool removeObject(std::string_view key) = 0;
  // Removes every key of the domain.
  virtual bool removeDomain() = 0;

  std::optional<PropertyList> objectForKey(std::string_view key) const;
  // Booleans, numbers (non-zero is true) and the strings YES/true/1 read as
  // true; anything else, or no value, reads false.
  bool boolForKey(std::string_view key) const;
  // Integers, reals (truncated), booleans and decimal strings; otherwise 0.
  int64_t integerForKey(std::string_view key) const;
  std::optional<std::string> stringForKey(std::string_view key) const;
  // An array whose string elements are kept; absent when not an array.
  std::optional<std::vector<std::string>> stringArrayForKey(std::string_view key) const;
};

class PreferencesStore {
 public:
  virtual ~PreferencesStore() = default;
  virtual std::shared_ptr<UserDefaults> defaultsForDomain(const std::string& domain) = 0;
  // The file a domain lives in (watched for changes).
  virtual fs::path fileForDomain(const std::string& domain) const = 0;
};

// Domains are files "<dir>/<domain>.plist".
std::unique_ptr<PreferencesStore> makePlistPreferencesStore(fs::path dir, FileManager& fileManager);

}  // namespace fbf
