// Names from the shared cache directory: any bytes as a session file name
// and as a custom feedback file in each known type directory. A name that
// parses must format back to a name that parses to the same value, and the
// classification must agree with the grammar.
#include "assembly/feedback_types.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/session_filename.h"
#include "fuzz_check.h"
#include "platform/logging.h"

#include <cstdint>
#include <string>

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  fbf::logging::setLevel(spdlog::level::off);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string name(reinterpret_cast<const char*>(data), size);
  auto parsed = fbf::SessionFilename::fromString(name);
  if (parsed) {
    FUZZ_CHECK(parsed->uploadPending == name.ends_with(".uploadPending"), "uploadPending disagrees with the name");
    for (const auto& formatted : {parsed->filenameString(), parsed->uploadFilenameString()}) {
      auto again = fbf::SessionFilename::fromString(formatted);
      FUZZ_CHECK(again.has_value(), "formatted name does not parse: %s", formatted.c_str());
      FUZZ_CHECK(again->sessionID == parsed->sessionID && again->processID == parsed->processID &&
                     again->state == parsed->state,
                 "formatted name parses to another session: %s", formatted.c_str());
    }
    auto plain = fbf::SessionFilename::fromString(parsed->filenameString());
    FUZZ_CHECK(!plain->uploadPending, "a plain name came back upload-pending");
    FUZZ_CHECK(fbf::parseUUID(parsed->sessionIDString()) == parsed->sessionID, "UUID text does not round trip");
  }

  // The enumerator sees names only as the last component of a path; a name
  // with a slash cannot come from a directory listing.
  if (name.empty() || name.find('/') != std::string::npos || name == "." || name == "..") return 0;
  const fs::path cache = "/cache/vireond";
  fbf::FeedbackFile inCache(cache / name);
  FUZZ_CHECK((inCache.fileType == fbf::FeedbackFileType::session) == parsed.has_value(),
             "a session name classified otherwise");
  FUZZ_CHECK(inCache.fileName() == name, "file name changed");
  FUZZ_CHECK(inCache.uploadPending() == name.ends_with(".uploadPending"), "uploadPending disagrees");
  if (!parsed) FUZZ_CHECK(inCache.typeString().empty(), "an unknown file has a type");
  for (const auto& type : fbf::allCustomFeedbackDirectories()) {
    fbf::FeedbackFile custom(cache / "CustomFeedback" / type / name);
    if (parsed) continue;
    FUZZ_CHECK(custom.fileType == fbf::FeedbackFileType::custom, "a file in %s is not custom", type.c_str());
    FUZZ_CHECK(custom.typeString() == type, "custom type %s read as %s", type.c_str(), custom.typeString().c_str());
    FUZZ_CHECK(custom.knownFeedbackType() != 0, "type directory %s has no code", type.c_str());
  }
  return 0;
}
