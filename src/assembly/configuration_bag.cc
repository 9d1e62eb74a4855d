#include "assembly/configuration_bag.h"

#include "assembly/fbf_strings.h"
#include "platform/logging.h"

namespace fbf {

std::optional<ConfigurationBag> ConfigurationBag::fromFile(const fs::path& path, const FileManager& fm) {
  std::error_code ec;
  auto bytes = fm.readFile(path, ec);
  if (!bytes) {
    logging::get("FBFAssembly").error("Cannot read configuration bag {}: {}", path.string(), ec.message());
    return std::nullopt;
  }
  std::string why;
  auto parsed = parsePropertyList(*bytes, &why);
  if (!parsed) {
    logging::get("FBFAssembly").error("Ignoring malformed configuration bag {}: {}", path.string(), why);
    return std::nullopt;
  }
  if (!parsed->is_object()) {
    logging::get("FBFAssembly").error("Ignoring configuration bag {}: top level is not a dictionary", path.string());
    return std::nullopt;
  }
  return ConfigurationBag(std::move(*parsed));
}

std::optional<ConfigurationBag> ConfigurationBagCache::read(const fs::path& path, const FileManager& fileManager) {
  auto stamp = FileStamp::of(path);
  std::lock_guard lock(mutex_);
  if (valid_ && path == path_ && stamp == stamp_) return bag_;
  bag_ = stamp.exists ? ConfigurationBag::fromFile(path, fileManager) : std::nullopt;
  path_ = path;
  stamp_ = stamp;
  valid_ = true;
  return bag_;
}

std::optional<std::string> ConfigurationBag::string(std::string_view key) const {
  auto it = values_.find(key);
  if (it == values_.end() || !it->is_string()) return std::nullopt;
  return it->get<std::string>();
}

std::optional<int64_t> ConfigurationBag::integer(std::string_view key) const {
  auto it = values_.find(key);
  if (it == values_.end()) return std::nullopt;
  if (it->is_number_integer()) return it->get<int64_t>();
  if (it->is_number_float()) {
    double d = it->get<double>();
    if (d > -9.2e18 && d < 9.2e18) return static_cast<int64_t>(d);
  }
  return std::nullopt;
}

std::optional<std::string> ConfigurationBag::feedbackURL() const { return string(FBFStrings::Defaults::FeedbackURL); }
std::optional<std::string> ConfigurationBag::crowdsourcingURL() const {
  return string(FBFStrings::Defaults::CrowdsourcingURL);
}
std::optional<int64_t> ConfigurationBag::feedbackMaxAgeInDays() const {
  return integer(FBFStrings::Defaults::FeedbackMaxAgeInDays);
}
std::optional<std::string> ConfigurationBag::vireonFeedbackFormat() const {
  return string(FBFStrings::Defaults::VireonFeedbackFormat);
}
std::optional<int64_t> ConfigurationBag::cohortsLookbackInDays() const {
  return integer(FBFStrings::Defaults::CohortsLookbackInDays);
}

std::map<std::string, uint64_t> ConfigurationBag::maxCustomFeedbackSizes() const {
  std::map<std::string, uint64_t> out;
  auto it = values_.find(FBFStrings::Defaults::MaxFeedbackSizes);
  if (it == values_.end() || !it->is_object()) return out;
  for (auto e = it->begin(); e != it->end(); ++e) {
    if (e->is_number_integer() && e->get<int64_t>() >= 0) out[e.key()] = static_cast<uint64_t>(e->get<int64_t>());
  }
  return out;
}

}  // namespace fbf
