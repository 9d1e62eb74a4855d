// Realistic search sessions and custom feedback files from a seed, for the
// demo, the tests and the benchmarks.
//
// A session holds several queries; each query has search starts and ends,
// visible suggestions and results whose identifiers recur across the query's
// feedback (rankings with sections and result rankings, engagements,
// gradings, section engagements, late sections), engaged-visit (CBA) records
// that match a shown web result at every level and some that match nothing,
// and a sprinkling of every other feedback kind, including payloads without a
// feedback message and custom feedback whose JSON is sometimes not an object.
// Agents cover every client surface. Serialised sizes follow a log-normal
// distribution (realistic mix: median about 20 KB, tail up to 2 MB).
// Timestamps are nanoseconds of a monotonic clock, as the search daemon
// writes them.
//
// With canaries on, every result and suggestion identifier, every visited
// address and every result engagement title carries a unique canary string:
// "cnry" + a kind letter (i identifier, u visited address, t title) + 16
// lower-case hex digits. All canaries have the same length, so none is part of
// another, and they are valid host name labels.
//
// Deterministic: the same options give the same sessions (std::mt19937_64),
// apart from session start times, which are spread back from `now`.
// Not thread-safe; one generator per thread.
#pragma once

#include "corevireon.pb.h"

#include <cstdint>
#include <filesystem>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <vector>

namespace fbf::sessiongen {

enum class SizeMix { small, realistic, large };
std::optional<SizeMix> sizeMixFromString(std::string_view text);

struct GeneratorOptions {
  uint64_t seed = 1;
  SizeMix sizeMix = SizeMix::realistic;
  bool plantCanaries = false;
  // Session start times are spread uniformly over the `days` days before
  // `now` (seconds since 1970).
  int days = 1;
  double now = 1'700'000'000.0;
};

// The canaries planted in one session, by kind.
struct SessionCanaries {
  std::vector<std::string> identifiers;
  std::vector<std::string> visitedAddresses;
  std::vector<std::string> titles;
};

struct GeneratedSession {
  corevireon::CVClientSession session;
  SessionCanaries canaries;
};

struct CustomFeedbackFile {
  std::string typeName;  // also the directory name under CustomFeedback/
  std::string fileName;
  std::string contents;
};

class SessionGenerator {
 public:
  explicit SessionGenerator(GeneratorOptions options);

  GeneratedSession nextSession();
  // A custom feedback file; successive calls cycle through the known types.
  CustomFeedbackFile nextCustomFeedback();
  // A random UUID in canonical upper-case form.
  std::string nextUUID();

  const GeneratorOptions& options() const { return options_; }

 private:
  friend class SessionBuilder;
  std::mt19937_64 rng_;
  GeneratorOptions options_;
  uint64_t canaryCounter_ = 0;
  size_t customCounter_ = 0;
};

// The bytes of a message with map entries in a fixed order, so that the same
// session always gives the same file.
std::string serializeDeterministically(const google::protobuf::Message& message);

struct WriteSummary {
  std::vector<std::filesystem::path> sessionFiles;
  std::vector<std::filesystem::path> customFeedbackFiles;
  std::vector<uint64_t> sessionSizes;
  // Every canary planted, in planting order.
  std::vector<std::string> canaries;
};

// Writes `sessions` closed session files named session.<pid>.<UUID>.closed
// into `cacheDir` and `customFiles` custom feedback files into
// `cacheDir`/CustomFeedback/<type>/, creating the directories (0700); every
// file is 0600. None (with a reason in `error`) when a file or directory
// cannot be written.
std::optional<WriteSummary> writeCacheDirectory(const std::filesystem::path& cacheDir, int sessions, int customFiles,
                                                SessionGenerator& generator, std::string* error);

}  // namespace fbf::sessiongen
