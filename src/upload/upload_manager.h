// Turns one piece of feedback into one compressed upload file plus one POST
// request, sends it over the assembly's upload session, and applies the
// outcome rules: HTTP 200 deletes the file (with a deletion event, reason
// "uploaded"); an offline-class network error cancels the flush in progress;
// anything else leaves the file for a later retry, and a retry of a file older
// than the bag's age limit deletes it (deletion event, reason "too old").
//
// One manager is made per flush, on the assembly's work queue, and used only
// there; completions of its session arrive there too, so it takes no locks.
// Given an encoder queue, it compresses session payloads there, touching
// nothing of its own: the job carries its request, file names and payload,
// and its result comes back to the work queue.
// The bag is read once, at construction. The upload session is made at
// construction and asked to finish its tasks and invalidate when the manager
// is destroyed; completions that arrive after that still apply the outcome
// rules but no longer call the delegate.
//
// Upload files are written under a hidden ".<name>.partial" name and renamed
// into place once whole, so an upload file that exists always holds a whole
// payload; a preparation that fails leaves nothing behind.
//
// Endpoints: session feedback and every custom type go to the bag's
// "feedback_url", except "Crowdsourcing", which goes to "crowdsourcing_url"
// when the bag has one (and to "feedback_url" otherwise).
#pragma once

#include "assembly/age_limit.h"
#include "flushing/session_filename.h"
#include "flushing/upload_manager_protocol.h"
#include "platform/task_queue.h"
#include "upload/url_request_builder.h"

#include <nlohmann/json.hpp>

#include <functional>
#include <memory>
#include <optional>
#include <map>
#include <string>
#include <vector>

namespace corevireon {
class CVClientSession;
}

namespace fbf {

// The build facts that decide the "seed" and "internal" query items.
struct UploadBuildPredicates {
  std::function<bool()> isSeedBuild;      // default: vireon_isSeedBuild
  std::function<bool()> isInternalBuild;  // default: vireon_isInternalBuild
};

class UploadManager final : public UploadManagerProtocol {
 public:
  // The client key sent with every upload.
  static constexpr std::string_view kClientKey = "galleon5290";
  static constexpr std::chrono::seconds kUploadTimeout{600};

  // Without an encoder queue session payloads are compressed on the work
  // queue, within `prepareSessionUpload`.
  explicit UploadManager(FBFAssemblyProtocol& assembly, UploadBuildPredicates predicates = {},
                         std::shared_ptr<TaskQueue> encoder = nullptr);
  ~UploadManager() override;
  UploadManager(const UploadManager&) = delete;
  UploadManager& operator=(const UploadManager&) = delete;

  // The POST request for `type` (empty: no "type" item) to `url`: query items
  // v, type, seed, internal, the "VIRDebugParameters" overrides, realtime,
  // key; headers User-Agent, Content-Encoding and, for "FeedbackV2PB" (exact)
  // or "UserReport"/"Usage" (any case), Content-Type "application/protobuf".
  // Throws URLError for a URL that is not http(s) or cannot be parsed.
  HttpRequest feedbackUploadRequest(const std::string& url, const std::string& type);

  void prepareSessionUpload(std::string payload, UploadFormat format, const fs::path& sessionURL,
                            PreparationCompletion completion) override;
  // The same, serialised here and compressed at once.
  std::optional<UploadRequest> uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                      const fs::path& sessionURL);
  std::optional<UploadRequest> uploadJSONFeedback(const nlohmann::ordered_json& dictionary,
                                                  const fs::path& sessionURL);
  std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) override;
  void enqueue(UploadRequest request, UploadCompletion completion) override;
  void retryUpload(const fs::path& fileURL, const std::string& typeString) override;
  void setDelegate(UploadManagerDelegate* delegate) override;

  // Where the upload file of a session goes: its upload name, in the shared
  // cache directory; no value without a cache directory.
  std::optional<fs::path> uploadFileForSession(const SessionFilename& session) const;
  // "<url>.uploadPending" beside `url`.
  static fs::path uploadFileForCustomFeedback(const fs::path& url);
  bool canFormRequest(const std::string& type) override;

  // The forced query items of a "VIRDebugParameters" value: pieces split at
  // "&", each split at "=" (empty parts dropped); only pieces of exactly two
  // parts count.
  static std::vector<QueryItem> debugQueryItems(std::string_view parameters);
  // The endpoint a custom feedback type is uploaded to (see above).
  static std::optional<std::string> endpointForCustomType(const ConfigurationBag& bag, const std::string& type);
  // Makes UploadManagers with the default build predicates that compress on
  // `encoder`.
  static UploadManagerFactory factory(std::shared_ptr<TaskQueue> encoder);

  size_t uploadsInFlight() const override;

 private:
  struct Core;
  struct SessionJob;
  std::optional<std::string> endpointFor(const std::string& type) const;
  // The upload file of the session file at `sessionURL` in `format`; logs
  // when there is none.
  std::optional<fs::path> uploadFileForSessionAt(const fs::path& sessionURL, UploadFormat format) const;
  // The request for `type`, or no value after logging why not.
  std::optional<HttpRequest> requestFor(const std::string& type);
  // The session's request and upload file, formed on the work queue; no
  // value after logging why not.
  std::optional<SessionJob> sessionJob(std::string payload, UploadFormat format, const fs::path& sessionURL);

  FBFAssemblyProtocol& assembly_;
  UploadBuildPredicates predicates_;
  std::shared_ptr<HttpClientSession> uploadSession_;
  std::shared_ptr<TaskQueue> encoder_;
  std::optional<ConfigurationBag> bag_;
  FeedbackAgeLimit ageLimit_;
  FileManager& fileManager_;
  std::map<std::string, bool> usableTypes_;  // canFormRequest, by type
  std::shared_ptr<Core> core_;
};

}  // namespace fbf
