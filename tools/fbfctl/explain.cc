#include "fbfctl/explain.h"

#include "assembly/cache_paths.h"
#include "assembly/configuration_bag.h"
#include "assembly/fbf_strings.h"
#include "fbfctl/payload_json.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/session_payload.h"
#include "platform/file_manager.h"

#include <nlohmann/json.hpp>

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>

namespace fbf::fbfctl {
namespace {

constexpr int kFailed = 1;
constexpr int kUsage = 2;

class Explain {
 public:
  explicit Explain(const Environment& env) : env_(env), fileManager_(makePosixFileManager(env.dirs)) {}

  int run(const std::vector<std::string>& args) {
    bool raw = false;
    std::optional<std::string> argument;
    for (const auto& a : args) {
      if (a == "--raw" && !raw) {
        raw = true;
      } else if (!argument && !a.empty() && a[0] != '-') {
        argument = a;
      } else {
        return fail("explain takes [--raw] PATH (see fbfctl --help)", kUsage);
      }
    }
    if (!argument) return fail("explain takes [--raw] PATH (see fbfctl --help)", kUsage);

    auto cacheDir = cacheDirNoCreate(*fileManager_);
    if (!cacheDir) return fail("cannot locate the cache directory");
    std::error_code ec;
    const fs::path cache = fs::absolute(*cacheDir, ec).lexically_normal();
    const fs::path path = fs::absolute(*argument, ec).lexically_normal();
    if (ec) return fail("cannot make " + *argument + " absolute: " + ec.message());
    std::string why;
    if (!insideWithoutLinks(cache, path, why)) return fail(*argument + ": " + why);

    FeedbackFile file(path);
    const bool isSession = file.fileType == FeedbackFileType::session && path.parent_path() == cache;
    const bool isCustom = file.fileType == FeedbackFileType::custom &&
                          path.parent_path().parent_path() == cache / FBFStrings::CustomFeedbackDirectory;
    if (!isSession && !isCustom) {
      return fail(*argument + ": not a session file of the cache directory nor a custom feedback file");
    }
    if (file.uploadPending()) {
      return fail(*argument + ": already prepared for upload; its payload is the compressed file itself");
    }

    FileDescriptor fd = fileManager_->openForReading(path, ec);
    if (!fd.valid()) return fail("cannot open " + *argument + ": " + ec.message());
    auto bytes = readAll(fd.get());
    if (!bytes) return fail("cannot read " + *argument + ": " + std::strerror(errno));

    nlohmann::ordered_json out;
    out["file"] = path.string();
    if (isCustom) {
      // Custom feedback is uploaded as its writer wrote it.
      out["kind"] = "custom";
      return print(out, raw, *bytes, file.typeString(), nullptr);
    }

    out["kind"] = "session";
    if (file.sessionFilename && file.sessionFilename->state != SessionFileState::closed) {
      out["note"] = "the session is not closed; a flush leaves it alone until it is";
    }
    std::optional<ConfigurationBag> bag;
    if (auto url = cachedBagURL(*fileManager_); url && fileManager_->exists(*url)) {
      bag = ConfigurationBag::fromFile(*url, *fileManager_);
    }
    if (!bag) return fail("no usable cached bag (bag.plist): the next flush uploads nothing");
    const SessionPayloadFormat format = sessionPayloadFormat(bag);
    SessionPayload payload = makeSessionPayload(*bytes, format, /*usageSink=*/nullptr);
    switch (payload.outcome) {
      case SessionPayload::Outcome::undecodable:
        return fail(*argument + ": not a session (File contents did not deserialize into a _CVClientSession)");
      case SessionPayload::Outcome::noFeedback:
        return fail(*argument + ": the session holds no feedback; nothing is uploaded for it");
      case SessionPayload::Outcome::ok:
        break;
    }
    return print(out, raw, payload.bytes, std::string(sessionPayloadTypeString(format)), &payload.summary);
  }

 private:
  int fail(const std::string& reason, int status = kFailed) {
    *env_.err << "fbfctl: " << reason << "\n";
    return status;
  }

  int print(nlohmann::ordered_json& out, bool raw, const std::string& payload, const std::string& type,
            const SessionRewriteSummary* summary) {
    if (raw) {
      env_.out->write(payload.data(), static_cast<std::streamsize>(payload.size()));
      env_.out->flush();
      return env_.out->good() ? 0 : fail("cannot write the payload");
    }
    out["type"] = type;
    out["upload"] = describeUpload(payload, type);
    if (summary) {
      nlohmann::ordered_json rewrite;
      rewrite["identifiersMapped"] = summary->identifiersMapped;
      rewrite["titlesCleared"] = summary->titlesCleared;
      rewrite["visitsReducedToALevel"] = summary->visitsReduced;
      rewrite["visitsDropped"] = summary->visitsDropped;
      rewrite["unknownFieldsDiscarded"] = summary->unknownFieldsDiscarded;
      rewrite["timestampsRemoved"] = summary->timestampsRemoved;
      out["rewrite"] = std::move(rewrite);
    } else {
      out["rewrite"] = nullptr;
    }
    *env_.out << out.dump(2) << "\n";
    return 0;
  }

  // `path` lies below `cache`, and neither it nor a directory between the
  // two is a symbolic link; `path` is a regular file of this user.
  static bool insideWithoutLinks(const fs::path& cache, const fs::path& path, std::string& why) {
    const fs::path relative = path.lexically_relative(cache);
    if (relative.empty() || *relative.begin() == ".." || relative == ".") {
      why = "not inside the cache directory " + cache.string();
      return false;
    }
    fs::path walked = cache;
    for (const auto& part : relative) {
      walked /= part;
      struct stat st {};
      if (::lstat(walked.c_str(), &st) != 0) {
        why = walked.string() + ": " + std::strerror(errno);
        return false;
      }
      if (S_ISLNK(st.st_mode)) {
        why = walked.string() + " is a symbolic link";
        return false;
      }
      if (walked == path) {
        if (!S_ISREG(st.st_mode)) {
          why = "not a regular file";
          return false;
        }
        if (st.st_uid != ::getuid()) {
          why = "not owned by this user";
          return false;
        }
      }
    }
    return true;
  }

  static std::optional<std::string> readAll(int fd) {
    std::string out;
    char buffer[65536];
    while (true) {
      ssize_t n = ::read(fd, buffer, sizeof buffer);
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) return std::nullopt;
      if (n == 0) return out;
      out.append(buffer, static_cast<size_t>(n));
    }
  }

  const Environment& env_;
  std::unique_ptr<FileManager> fileManager_;
};

}  // namespace

int explain(const std::vector<std::string>& args, const Environment& env) { return Explain(env).run(args); }

}  // namespace fbf::fbfctl
