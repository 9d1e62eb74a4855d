// What the flusher needs from the upload manager, declared here so that the
// flushing code does not depend on the upload implementation; the composition
// root hands the flusher an `UploadManagerFactory`.
//
// An upload manager lives on the assembly's work queue: every call is made
// there, and completions and delegate calls arrive there.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "platform/file_manager.h"
#include "flushing/session_filename.h"
#include "platform/http_session.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace fbf {

// One prepared upload: the POST request (headers complete), the compressed
// file sent as its body, the byte counts in and out of the compressor, and
// the feedback type name.
struct UploadRequest {
  HttpRequest request;
  fs::path fileURL;
  int64_t uncompressedSize = 0;
  int64_t compressedSize = 0;
  std::string typeString;
  // Files that go with the upload file the moment the server accepts it
  // (the claimed file it was made from), so that a crash right after the
  // 200 cannot send the payload again.
  std::vector<fs::path> removeOnAcceptance;

  // A request for a file compressed by an earlier run: both sizes are 0.
  static UploadRequest retryRequest(HttpRequest request, fs::path fileURL, std::string typeString) {
    return UploadRequest{std::move(request), std::move(fileURL), 0, 0, std::move(typeString), {}};
  }
};

class UploadManagerDelegate {
 public:
  virtual ~UploadManagerDelegate() = default;
  // After every finished upload task, successful or not; `status` is the
  // HTTP status, 0 when there was no HTTP response.
  virtual void uploadManagerDidUploadFile(const fs::path& file, long status) = 0;
};

using UploadCompletion = std::function<void(std::optional<HttpResponse>, std::optional<HttpError>)>;

class UploadManagerProtocol {
 public:
  virtual ~UploadManagerProtocol() = default;

  // Each preparation forms the request and compresses its payload into the
  // upload file, which appears under its name only once whole; no request on
  // any failure (already logged), and then no upload file is left behind.

  // A session's payload, already serialised in `format`, for the session
  // file at `sessionURL` (which names the upload file: its upload name, in
  // the shared cache directory). The compression may run off the work queue,
  // so that the next file is processed meanwhile; `completion` runs on the
  // work queue, possibly before this call returns.
  using PreparationCompletion = std::function<void(std::optional<UploadRequest>)>;
  virtual void prepareSessionUpload(std::string payload, UploadFormat format, const fs::path& sessionURL,
                                    PreparationCompletion completion) = 0;
  // Compresses `fileURL` into "<fileURL>.uploadPending" beside it.
  virtual std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) = 0;

  // Whether an upload of `type` can be formed now: the bag names a usable
  // endpoint for it. Files whose uploads cannot be formed are left as they
  // are for a later flush; the reason is logged once per manager and type.
  virtual bool canFormRequest(const std::string& type) {
    (void)type;
    return true;
  }

  // Starts the upload. On HTTP 200 the upload file is deleted; otherwise it
  // stays for a retry. An offline-class network error cancels the flush.
  virtual void enqueue(UploadRequest request, UploadCompletion completion) = 0;
  // Re-sends an upload file left by an earlier run, or deletes it (with a
  // deletion event) when it is older than the bag's age limit.
  virtual void retryUpload(const fs::path& fileURL, const std::string& typeString) = 0;

  // Uploads enqueued whose outcome (delegate call) has not come yet; the
  // count drops before the delegate is called.
  virtual size_t uploadsInFlight() const = 0;

  // Not owned; must outlive the manager or be cleared first.
  virtual void setDelegate(UploadManagerDelegate* delegate) = 0;
};

using UploadManagerFactory = std::function<std::unique_ptr<UploadManagerProtocol>(FBFAssemblyProtocol&)>;

}  // namespace fbf
