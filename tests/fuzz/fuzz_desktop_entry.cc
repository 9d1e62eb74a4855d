// Desktop entries are written by any installed package. Any bytes through
// the entry parser; the desktop file ID of any relative path.
#include "fuzz_check.h"
#include "platform/logging.h"
#include "whitelist/desktop_entries.h"

#include <cstdint>
#include <string>

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string text(reinterpret_cast<const char*>(data), size);
  std::string error;
  auto entry = fbf::parseDesktopEntry(text, &error);
  if (!entry) {
    FUZZ_CHECK(!error.empty(), "a rejected entry must say why");
  } else {
    FUZZ_CHECK(text.find("[Desktop Entry]") != std::string::npos, "an entry without its group");
    if (entry->isApplication) FUZZ_CHECK(text.find("Application") != std::string::npos, "application from nowhere");
    if (entry->hidden) FUZZ_CHECK(text.find("Hidden") != std::string::npos, "hidden from nowhere");
    for (const auto& name : entry->implements) {
      FUZZ_CHECK(!name.empty(), "an empty interface name");
      FUZZ_CHECK(text.find("Implements") != std::string::npos, "interfaces from nowhere");
    }
    // The same text gives the same answer.
    auto again = fbf::parseDesktopEntry(text);
    FUZZ_CHECK(again && again->isApplication == entry->isApplication && again->hidden == entry->hidden &&
                   again->implements == entry->implements,
               "parsing is not deterministic");
  }

  // Relative paths as a directory walk yields them.
  if (text.empty() || text.front() == '/' || text.find('\0') != std::string::npos) return 0;
  auto id = fbf::desktopFileId(fs::path(text));
  FUZZ_CHECK(id.find('/') == std::string::npos, "a desktop file ID with a slash: %s", id.c_str());
  return 0;
}
