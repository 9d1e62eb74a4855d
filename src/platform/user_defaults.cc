#include "platform/user_defaults.h"

#include "platform/file_stamp.h"
#include "platform/logging.h"

#include <charconv>
#include <map>
#include <mutex>

namespace fbf {

std::optional<PropertyList> UserDefaults::objectForKey(std::string_view key) const {
  auto dict = snapshot();
  auto it = dict->find(key);
  if (it == dict->end()) return std::nullopt;
  return *it;
}

bool UserDefaults::boolForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (!v) return false;
  if (v->is_boolean()) return v->get<bool>();
  if (v->is_number_integer()) return v->get<int64_t>() != 0;
  if (v->is_number_float()) return v->get<double>() != 0.0;
  if (v->is_string()) {
    const auto& s = v->get_ref<const std::string&>();
    return s == "YES" || s == "yes" || s == "true" || s == "TRUE" || s == "1";
  }
  return false;
}

int64_t UserDefaults::integerForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (!v) return 0;
  if (v->is_number_integer()) return v->get<int64_t>();
  if (v->is_number_unsigned()) return static_cast<int64_t>(v->get<uint64_t>());
  if (v->is_number_float()) {
    double d = v->get<double>();
    if (!(d > -9.2e18 && d < 9.2e18)) return 0;
    return static_cast<int64_t>(d);
  }
  if (v->is_boolean()) return v->get<bool>() ? 1 : 0;
  if (v->is_string()) {
    const auto& s = v->get_ref<const std::string&>();
    int64_t out = 0;
    auto [ptr, ec] = std::from_chars(s.data(), s.data() + s.size(), out);
    if (ec == std::errc() && ptr == s.data() + s.size()) return out;
  }
  return 0;
}

std::optional<std::string> UserDefaults::stringForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (!v || !v->is_string()) return std::nullopt;
  return v->get<std::string>();
}

std::optional<std::vector<std::string>> UserDefaults::stringArrayForKey(std::string_view key) const {
  auto v = objectForKey(key);
  if (!v || !v->is_array()) return std::nullopt;
  std::vector<std::string> out;
  for (const auto& item : *v) {
    if (item.is_string()) out.push_back(item.get<std::string>());
  }
  return out;
}

namespace {

// The last parse of one domain's file, shared by every UserDefaults object of
// the domain.
class DomainCache {
 public:
  DomainCache(fs::path file, FileManager& fm) : file_(std::move(file)), fm_(fm) {}

  const fs::path& file() const { return file_; }
  FileManager& fileManager() const { return fm_; }

  std::shared_ptr<const PropertyList> values() {
    auto stamp = FileStamp::of(file_);
    std::lock_guard lock(mutex_);
    if (values_ && stamp == stamp_) return values_;
    values_ = std::make_shared<const PropertyList>(stamp.exists ? read() : PropertyList::object());
    stamp_ = stamp;
    return values_;
  }

  // After this process wrote the file: the next read parses it again even if
  // the write left the stamp unchanged.
  void invalidate() {
    std::lock_guard lock(mutex_);
    values_.reset();
  }

 private:
  PropertyList read() const {
    std::error_code ec;
    auto bytes = fm_.readFile(file_, ec);
    if (!bytes) {
      if (ec == std::errc::no_such_file_or_directory) return PropertyList::object();
      logging::get("UserDefaults").error("Cannot read preferences file {}: {}", file_.string(), ec.message());
      return PropertyList::object();
    }
    std::string why;
    auto parsed = parsePropertyList(*bytes, &why);
    if (!parsed) {
      logging::get("UserDefaults").error("Ignoring malformed preferences file {}: {}", file_.string(), why);
      return PropertyList::object();
    }
    if (!parsed->is_object()) {
      logging::get("UserDefaults").error("Ignoring preferences file {}: top level is not a dictionary", file_.string());
      return PropertyList::object();
    }
    return std::move(*parsed);
  }

  fs::path file_;
  FileManager& fm_;
  std::mutex mutex_;
  FileStamp stamp_;
  std::shared_ptr<const PropertyList> values_;
};

class PlistUserDefaults final : public UserDefaults {
 public:
  PlistUserDefaults(std::string domain, std::shared_ptr<DomainCache> cache)
      : domain_(std::move(domain)), cache_(std::move(cache)) {}

  const std::string& domain() const override { return domain_; }

  PropertyList dictionaryRepresentation() const override { return *cache_->values(); }
  std::shared_ptr<const PropertyList> snapshot() const override { return cache_->values(); }

  bool setObject(std::string_view key, const PropertyList& value) override {
    auto dict = dictionaryRepresentation();
    dict[std::string(key)] = value;
    return write(dict);
  }

  bool removeObject(std::string_view key) override {
    auto dict = dictionaryRepresentation();
    if (dict.erase(std::string(key)) == 0) return true;
    return write(dict);
  }

  bool removeDomain() override {
    std::error_code ec;
    auto& fm = cache_->fileManager();
    if (!fm.exists(cache_->file())) return true;
    bool removed = fm.removeItem(cache_->file(), ec);
    cache_->invalidate();
    return removed;
  }

 private:
  bool write(const PropertyList& dict) {
    std::error_code ec;
    auto& fm = cache_->fileManager();
    const auto& file = cache_->file();
    bool ok = fm.createOrFixDirectory(file.parent_path(), ec) &&
              fm.writeFileAtomically(file, serializePropertyList(dict, PropertyListFormat::xml), ec);
    cache_->invalidate();
    if (!ok) {
      logging::get("UserDefaults").error("Cannot write preferences file {}: {}", file.string(), ec.message());
      return false;
    }
    return true;
  }

  std::string domain_;
  std::shared_ptr<DomainCache> cache_;
};

class PlistPreferencesStore final : public PreferencesStore {
 public:
  PlistPreferencesStore(fs::path dir, FileManager& fm) : dir_(std::move(dir)), fm_(fm) {}
  std::shared_ptr<UserDefaults> defaultsForDomain(const std::string& domain) override {
    std::lock_guard lock(mutex_);
    auto& cache = caches_[domain];
    if (!cache) cache = std::make_shared<DomainCache>(fileForDomain(domain), fm_);
    return std::make_shared<PlistUserDefaults>(domain, cache);
  }
  fs::path fileForDomain(const std::string& domain) const override { return dir_ / (domain + ".plist"); }

 private:
  fs::path dir_;
  FileManager& fm_;
  std::mutex mutex_;
  std::map<std::string, std::shared_ptr<DomainCache>> caches_;
};

}  // namespace

std::unique_ptr<PreferencesStore> makePlistPreferencesStore(fs::path dir, FileManager& fileManager) {
  return std::make_unique<PlistPreferencesStore>(std::move(dir), fileManager);
}

}  // namespace fbf
