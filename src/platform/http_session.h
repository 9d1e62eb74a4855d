// The HTTP client session used for uploads.
//
// A session sends upload-from-file POST requests and delivers each completion
// on the delegate queue given at creation. TLS peer verification is always on.
// `finishTasksAndInvalidate` lets running tasks finish, then calls the
// configuration's `onInvalidated` once (on the delegate queue) and refuses new
// tasks. `cancelAllTasks` abandons every task, queued or running: each
// completion is called with a `cancelled` error of the URL domain, so the
// caller keeps its file for a later run. Thread-safety: every member may be
// called from any thread.
#pragma once

#include "platform/task_queue.h"

#include <chrono>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace fbf {

using HttpHeaders = std::vector<std::pair<std::string, std::string>>;

struct HttpRequest {
  std::string url;
  std::string method = "POST";
  HttpHeaders headers;
  std::chrono::seconds timeout{60};
  // Ignore any locally cached response (no cache is kept anyway).
  bool ignoreLocalCache = false;
  // Optional: called on the session's own thread as soon as the HTTP status
  // is known, before the completion is queued. For work that must not wait
  // behind the delegate queue; it must be quick and thread-safe.
  std::function<void(long status)> onStatus;

  std::optional<std::string> header(std::string_view name) const;
};

struct HttpResponse {
  long statusCode = 0;
  HttpHeaders headers;
};

// Where an error comes from: the URL-loading layer, the network stack, or
// anything else (which the upload rules treat like "no error").
enum class HttpErrorDomain { url, network, other };
enum class HttpErrorCode {
  notConnectedToInternet,
  dnsLookupFailed,
  cannotConnectToHost,
  cannotFindHost,
  timedOut,
  secureConnectionFailed,
  cancelled,
  fileUnreadable,
  other,
};

struct HttpError {
  HttpErrorDomain domain = HttpErrorDomain::other;
  HttpErrorCode code = HttpErrorCode::other;
  std::string description;
};

using HttpCompletion = std::function<void(std::optional<HttpResponse>, std::optional<HttpError>)>;

class HttpClientSession {
 public:
  virtual ~HttpClientSession() = default;
  virtual void uploadFile(HttpRequest request, std::filesystem::path body, HttpCompletion completion) = 0;
  virtual void finishTasksAndInvalidate() = 0;
  virtual void cancelAllTasks() = 0;
};

struct HttpSessionConfiguration {
  std::shared_ptr<TaskQueue> delegateQueue;
  std::function<void()> onInvalidated;
  // HTTP/1.1 connections to one host; over HTTP/2 the transfers share one
  // connection as streams instead.
  int maxConnectionsPerHost = 1;
  // libcurl pinned-public-key string ("sha256//...;sha256//..." or a PEM/DER file).
  std::optional<std::string> pinnedPublicKeys;
  // PEM bundle replacing the system trust store.
  std::optional<std::filesystem::path> caFile;
};

using HttpSessionFactory = std::function<std::shared_ptr<HttpClientSession>(HttpSessionConfiguration)>;

}  // namespace fbf
