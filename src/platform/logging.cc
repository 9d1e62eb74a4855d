#include "platform/logging.h"

#include <spdlog/sinks/dist_sink.h>
#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/sinks/systemd_sink.h>
#include <sys/stat.h>

#include <cstdlib>
#include <map>
#include <mutex>
#include <string>

namespace fbf::logging {
namespace {

struct Registry {
  std::mutex mutex;
  std::shared_ptr<spdlog::sinks::dist_sink_mt> dist = std::make_shared<spdlog::sinks::dist_sink_mt>();
  spdlog::sink_ptr output;
  std::map<std::string, std::shared_ptr<spdlog::logger>, std::less<>> loggers;
  spdlog::level::level_enum level = spdlog::level::info;
  bool initialised = false;
};

Registry& registry() {
  static auto* r = new Registry();  // never destroyed: logging may run during exit
  return *r;
}

bool stderrIsJournal() {
  const char* js = std::getenv("JOURNAL_STREAM");
  if (!js) return false;
  struct stat st {};
  if (fstat(2, &st) != 0) return false;
  unsigned long long dev = 0, ino = 0;
  if (std::sscanf(js, "%llu:%llu", &dev, &ino) != 2) return false;
  return dev == static_cast<unsigned long long>(st.st_dev) &&
         ino == static_cast<unsigned long long>(st.st_ino);
}

spdlog::level::level_enum levelFromEnv() {
  const char* v = std::getenv("VIREON_FBF_LOG_LEVEL");
  if (!v || !*v) return spdlog::level::info;
  auto l = spdlog::level::from_str(v);
  return l == spdlog::level::off && std::string_view(v) != "off" ? spdlog::level::info : l;
}

void initLocked(Registry& r) {
  if (r.initialised) return;
  r.initialised = true;
  r.level = levelFromEnv();
  if (stderrIsJournal()) {
    r.output = std::make_shared<spdlog::sinks::systemd_sink_mt>("vireon-fbf");
    r.output->set_pattern("%n: %v");
  } else {
    r.output = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    r.output->set_pattern("%Y-%m-%d %H:%M:%S.%e %P %^%l%$ [%n] %v");
  }
  r.dist->add_sink(r.output);
  for (auto& [_, logger] : r.loggers) logger->set_level(r.level);
}

}  // namespace

spdlog::logger& get(std::string_view category, std::string_view subsystem) {
  auto& r = registry();
  std::lock_guard lock(r.mutex);
  initLocked(r);
  std::string name;
  name.reserve(subsystem.size() + 1 + category.size());
  name.append(subsystem).append(":").append(category);
  auto it = r.loggers.find(name);
  if (it != r.loggers.end()) return *it->second;
  auto logger = std::make_shared<spdlog::logger>(name, r.dist);
  logger->set_level(r.level);
  logger->flush_on(spdlog::level::trace);
  auto& ref = *logger;
  r.loggers.emplace(std::move(name), std::move(logger));
  return ref;
}

void init() {
  auto& r = registry();
  std::lock_guard lock(r.mutex);
  initLocked(r);
}

void addSink(const spdlog::sink_ptr& sink) {
  auto& r = registry();
  std::lock_guard lock(r.mutex);
  initLocked(r);
  r.dist->add_sink(sink);
}

void removeSink(const spdlog::sink_ptr& sink) {
  auto& r = registry();
  std::lock_guard lock(r.mutex);
  r.dist->remove_sink(sink);
}

void setLevel(spdlog::level::level_enum level) {
  auto& r = registry();
  std::lock_guard lock(r.mutex);
  initLocked(r);
  r.level = level;
  for (auto& [_, logger] : r.loggers) logger->set_level(level);
}

}  // namespace fbf::logging
