#include "whitelist/notification_poster.h"

#include "platform/logging.h"

#include <systemd/sd-bus.h>

#include <cstring>
#include <string>

namespace fbf {
namespace {

spdlog::logger& notificationLog() { return logging::get("Notifications"); }

constexpr const char* kObjectPath = "/vireon_fbf";
constexpr const char* kInterface = "vireon_fbf.Notifications";
constexpr const char* kMember = "Posted";

class SessionBusNotificationPoster final : public NotificationPoster {
 public:
  void post(std::string_view name) override {
    std::string text(name);
    sd_bus* bus = nullptr;
    int r = sd_bus_open_user(&bus);
    if (r < 0) {
      notificationLog().debug("no session bus ({}); notification {} not sent", std::strerror(-r),
                              text);
      return;
    }
    r = sd_bus_emit_signal(bus, kObjectPath, kInterface, kMember, "s", text.c_str());
    if (r >= 0) r = sd_bus_flush(bus);
    sd_bus_flush_close_unref(bus);
    if (r < 0) {
      notificationLog().debug("could not post notification {}: {}", text, std::strerror(-r));
      return;
    }
    notificationLog().debug("posted notification {}", text);
  }
};

}  // namespace

std::unique_ptr<NotificationPoster> makeSessionBusNotificationPoster() {
  return std::make_unique<SessionBusNotificationPoster>();
}

}  // namespace fbf
