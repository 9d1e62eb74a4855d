// The analytics sink: named events with a lazily built payload.
//
// The payload function is called only when the sink actually records the
// event; when it yields no value nothing is recorded.
// Thread-safety: implementations are callable from any thread.
#pragma once

#include "platform/clock.h"
#include "platform/file_manager.h"

#include <nlohmann/json.hpp>

#include <functional>
#include <memory>
#include <optional>
#include <string_view>

namespace fbf {

class AnalyticsSink {
 public:
  virtual ~AnalyticsSink() = default;
  virtual void sendEvent(std::string_view name, const std::function<std::optional<nlohmann::json>()>& payload) = 0;
};

// Appends one JSON line per event ({"time","event","payload"}) to `file`
// (created owner-only, parent directories too) and logs it at debug level.
// The file is kept open between events and opened again when its path no
// longer leads to it (removed or rotated).
std::unique_ptr<AnalyticsSink> makeJsonLinesAnalyticsSink(fs::path file, FileManager& fileManager, const Clock& clock);

}  // namespace fbf
