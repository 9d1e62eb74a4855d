#include "platform/user_defaults.h"

#include "platform/logging.h"

#include <charconv>

namespace fbf {

std::optional<PropertyList> UserDefaults::objectForKey(std::string_view key) const {
  auto dict = dictionaryRepresentation();
  auto it = dict.find(key);
  if (it == dict.end()) return std::nullopt;
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

class PlistUserDefaults final : public UserDefaults {
 public:
  PlistUserDefaults(std::string domain, fs::path file, FileManager& fm)
      : domain_(std::move(domain)), file_(std::move(file)), fm_(fm) {}

  const std::string& domain() const override { return domain_; }

  PropertyList dictionaryRepresentation() const override {
    std::error_code ec;
    if (!fm_.exists(file_)) return PropertyList::object();
    auto bytes = fm_.readFile(file_, ec);
    if (!bytes) {
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
    return *parsed;
  }

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
    if (!fm_.exists(file_)) return true;
    return fm_.removeItem(file_, ec);
  }

 private:
  bool write(const PropertyList& dict) {
    std::error_code ec;
    if (!fm_.createOrFixDirectory(file_.parent_path(), ec) ||
        !fm_.writeFileAtomically(file_, serializePropertyList(dict, PropertyListFormat::xml), ec)) {
      logging::get("UserDefaults").error("Cannot write preferences file {}: {}", file_.string(), ec.message());
      return false;
    }
    return true;
  }

  std::string domain_;
  fs::path file_;
  FileManager& fm_;
};

class PlistPreferencesStore final : public PreferencesStore {
 public:
  PlistPreferencesStore(fs::path dir, FileManager& fm) : dir_(std::move(dir)), fm_(fm) {}
  std::shared_ptr<UserDefaults> defaultsForDomain(const std::string& domain) override {
    return std::make_shared<PlistUserDefaults>(domain, fileForDomain(domain), fm_);
  }
  fs::path fileForDomain(const std::string& domain) const override { return dir_ / (domain + ".plist"); }

 private:
  fs::path dir_;
  FileManager& fm_;
};

}  // namespace

std::unique_ptr<PreferencesStore> makePlistPreferencesStore(fs::path dir, FileManager& fileManager) {
  return std::make_unique<PlistPreferencesStore>(std::move(dir), fileManager);
}

}  // namespace fbf
