#include "assembly/feedback_loss_ledger.h"

#include "platform/logging.h"

#include <fcntl.h>
#include <unistd.h>

#include <map>
#include <sstream>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FBFAssembly"); }

struct Line {
  double time = 0;
  int32_t type = 0;
  int32_t reason = 0;
};

std::optional<Line> parseLine(const std::string& text) {
  auto json = nlohmann::json::parse(text, nullptr, false);
  if (!json.is_object()) return std::nullopt;
  auto time = json.find("time"), type = json.find("type"), reason = json.find("reason");
  if (time == json.end() || type == json.end() || reason == json.end()) return std::nullopt;
  if (!time->is_number() || !type->is_number_integer() || !reason->is_number_integer()) return std::nullopt;
  return Line{time->get<double>(), type->get<int32_t>(), reason->get<int32_t>()};
}

}  // namespace

FeedbackLossLedger::FeedbackLossLedger(fs::path file, FileManager& fm, SystemTime now)
    : file_(std::move(file)), fm_(fm) {
  std::error_code ec;
  if (!fm_.createOrFixDirectory(file_.parent_path(), ec)) {
    log().error("Cannot create {}: {}", file_.parent_path().string(), ec.message());
    return;
  }
  // Drop what has left the window. Lines are appended as events happen, so
  // the old ones are at the head: only the head is parsed, up to the first
  // line inside the window, and the file is rewritten only when something
  // goes. A week of uploads is tens of thousands of lines, and the daemon
  // starts often. A line behind that one (the clock was set back) stays
  // until a later start and is ignored by countsSince; a head line stamped
  // more than a window ahead of now is taken for a clock error and dropped.
  if (auto text = fm_.readFile(file_, ec)) {
    const double cutoff = secondsSinceEpoch(now - kWindow);
    const double ahead = secondsSinceEpoch(now + kWindow);
    size_t keepFrom = 0;
    while (keepFrom < text->size()) {
      size_t end = text->find('\n', keepFrom);
      end = end == std::string::npos ? text->size() : end + 1;
      auto parsed = parseLine(text->substr(keepFrom, end - keepFrom));
      if (parsed && parsed->time >= cutoff && parsed->time <= ahead) break;
      keepFrom = end;
    }
    if (keepFrom > 0 && !fm_.writeFileAtomically(file_, std::string_view(*text).substr(keepFrom), ec)) {
      log().error("Cannot rewrite {}: {}", file_.string(), ec.message());
    }
  }
  fd_ = ::open(file_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd_ < 0) log().error("Cannot open {}", file_.string());
}

FeedbackLossLedger::~FeedbackLossLedger() {
  if (fd_ >= 0) ::close(fd_);
}

void FeedbackLossLedger::record(const FeedbackDeletionEvent& event, SystemTime when) {
  nlohmann::json line = {{"time", secondsSinceEpoch(when)}, {"type", event.feedbackType}, {"reason", event.reason}};
  std::string text = line.dump() + "\n";
  std::lock_guard lock(mutex_);
  if (fd_ < 0) return;
  // One write per line keeps lines whole with O_APPEND.
  if (::write(fd_, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    log().error("Short write to {}", file_.string());
  }
}

std::vector<FeedbackLossCount> FeedbackLossLedger::countsSince(SystemTime since) const {
  std::lock_guard lock(mutex_);
  std::error_code ec;
  auto text = fm_.readFile(file_, ec);
  if (!text) return {};
  const double cutoff = secondsSinceEpoch(since);
  std::map<std::pair<int32_t, int32_t>, uint64_t> counts;
  std::istringstream in(*text);
  for (std::string line; std::getline(in, line);) {
    auto parsed = parseLine(line);
    if (parsed && parsed->time >= cutoff) ++counts[{parsed->type, parsed->reason}];
  }
  std::vector<FeedbackLossCount> out;
  for (const auto& [key, n] : counts) out.push_back({key.first, key.second, n});
  return out;
}

}  // namespace fbf
