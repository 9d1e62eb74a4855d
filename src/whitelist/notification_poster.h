// Posting the system-wide notification that the assistant app list changed.
//
// On Linux the notification is a D-Bus signal on the user's session bus:
// object path "/vireon_fbf", interface "vireon_fbf.Notifications", member
// "Posted", one string argument holding the notification's name. Without a
// reachable session bus it is a debug log line only.
// Thread-safety: callable from any thread.
#pragma once

#include <memory>
#include <string_view>

namespace fbf {

class NotificationPoster {
 public:
  virtual ~NotificationPoster() = default;
  // Best effort: failures are logged, never reported.
  virtual void post(std::string_view name) = 0;
};

std::unique_ptr<NotificationPoster> makeSessionBusNotificationPoster();

}  // namespace fbf
