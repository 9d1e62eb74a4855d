#include "platform/http_session.h"

#include <strings.h>

namespace fbf {

std::optional<std::string> HttpRequest::header(std::string_view name) const {
  for (const auto& [k, v] : headers) {
    if (k.size() == name.size() && strncasecmp(k.data(), name.data(), k.size()) == 0) return v;
  }
  return std::nullopt;
}

}  // namespace fbf
