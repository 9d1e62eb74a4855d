#include "upload/upload_manager.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "flushing/session_payload.h"
#include "platform/logging.h"
#include "upload/compressed_output_stream.h"
#include "util/build_info.h"
#include "util/lock.h"

#include "corevireon.pb.h"

#include <fcntl.h>
#include <strings.h>
#include <unistd.h>

#include <array>
#include <cstring>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("UploadManager"); }

bool equalsIgnoringCase(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

void setHeader(HttpRequest& request, std::string_view name, const std::string& value) {
  for (auto& [k, v] : request.headers) {
    if (k == name) {
      v = value;
      return;
    }
  }
  request.headers.emplace_back(std::string(name), value);
}

std::vector<std::string_view> splitDroppingEmpty(std::string_view s, char sep) {
  std::vector<std::string_view> out;
  while (true) {
    auto pos = s.find(sep);
    auto piece = s.substr(0, pos);
    if (!piece.empty()) out.push_back(piece);
    if (pos == std::string_view::npos) break;
    s = s.substr(pos + 1);
  }
  return out;
}

int32_t feedbackTypeCode(const std::string& typeString) {
  return knownFeedbackTypeFromName(typeString, true).value_or(kKnownFeedbackTypeUnknown);
}

// The platform's offline-class errors: the flush cannot get anywhere now.
bool isOfflineError(const HttpError& e) {
  switch (e.code) {
    case HttpErrorCode::notConnectedToInternet:
    case HttpErrorCode::dnsLookupFailed:
    case HttpErrorCode::cannotConnectToHost:
    case HttpErrorCode::cannotFindHost:
      return true;
    default:
      return false;
  }
}

// An upload file gets its name only once complete, so that an upload file
// that exists always holds a whole payload, whatever moment the process dies
// at. It is written unnamed (O_TMPFILE) and linked into place: one directory
// change per file instead of a create and a rename, and a crash leaves
// nothing behind. Where the file system cannot do that it is written under a
// hidden name beside its final one and renamed; a writer that is not
// committed removes that partial file.
class PartialUploadFile {
 public:
  PartialUploadFile(FileManager& fm, fs::path finalPath)
      : fm_(fm), finalPath_(std::move(finalPath)),
        partialPath_(finalPath_.parent_path() / ("." + finalPath_.filename().string() + ".partial")) {}
  ~PartialUploadFile() {
    if (named_ && !committed_) {
      std::error_code ec;
      fm_.removeItem(partialPath_, ec);
    }
  }
  PartialUploadFile(const PartialUploadFile&) = delete;
  PartialUploadFile& operator=(const PartialUploadFile&) = delete;

  FileDescriptor create() {
    std::error_code ec;
    FileDescriptor fd = fm_.createUnnamedForWriting(finalPath_.parent_path(), ec);
    if (fd.valid()) {
      // The stream closes its descriptor when it finishes; the file is named
      // after that, through a descriptor of its own.
      unnamed_ = FileDescriptor(fcntl(fd.get(), F_DUPFD_CLOEXEC, 0));
      if (unnamed_.valid()) return fd;
    }
    named_ = true;
    return fm_.createForWriting(partialPath_, ec);
  }
  bool commit() {
    std::error_code ec;
    if (!named_) {
      committed_ = fm_.publish(unnamed_.get(), finalPath_, ec);
      if (committed_ || ec != std::errc::file_exists) return committed_;
      // An upload file of an earlier attempt has the name: replaced, as a
      // rename would, through the hidden name.
      fm_.removeItem(partialPath_, ec);
      named_ = fm_.publish(unnamed_.get(), partialPath_, ec);
      if (!named_) return false;
    }
    committed_ = fm_.moveItem(partialPath_, finalPath_, ec);
    return committed_;
  }
  const fs::path& finalPath() const { return finalPath_; }

 private:
  FileManager& fm_;
  fs::path finalPath_;
  fs::path partialPath_;
  FileDescriptor unnamed_;
  bool named_ = false;  // written under partialPath_
  bool committed_ = false;
};

}  // namespace

// What a finished task needs; shared with the completions so that they stay
// valid when the manager is gone before its session's last task.
struct UploadManager::Core {
  explicit Core(FBFAssemblyProtocol& a) : assembly(a) {}
  FBFAssemblyProtocol& assembly;
  UploadManagerDelegate* delegate = nullptr;
  // Enqueued tasks whose outcome has not arrived yet (work queue only).
  size_t inFlight = 0;

  void notifyDelegate(const fs::path& file, long status) const {
    if (delegate) delegate->uploadManagerDidUploadFile(file, status);
  }

  void taskDidComplete(const fs::path& fileURL, const std::optional<FileAttributes>& attributes,
                       const std::string& typeString, std::optional<HttpResponse> response,
                       std::optional<HttpError> error, const UploadCompletion& completion) {
    if (inFlight > 0) --inFlight;
    long status = response ? response->statusCode : 0;
    if (error && (error->domain == HttpErrorDomain::url || error->domain == HttpErrorDomain::network)) {
      if (isOfflineError(*error)) {
        log().error("Device appears to be offline. Flush cancelled.");
        assembly.setCancelled(true);
      }
      log().error("{} upload failed: {}", typeString, error->description);
      notifyDelegate(fileURL, status);
      if (completion) completion(std::move(response), std::move(error));
      return;
    }
    if (!response) {
      notifyDelegate(fileURL, 0);
      if (completion) completion(std::move(response), std::move(error));
      return;
    }
    if (response->statusCode == 200) {
      log().debug("{} upload completed successfully", typeString);
      auto& fm = assembly.fileManager();
      // The session's thread may have removed the file already (see enqueue).
      if (auto event = attributes ? FeedbackDeletionEvent::make(*attributes, feedbackTypeCode(typeString),
                                                                FeedbackDeletionReason::uploaded, assembly.currentDate())
                                  : std::nullopt) {
        assembly.didDeleteFeedbackFile(*event);
      }
      std::error_code ec;
      if (!fm.removeItem(fileURL, ec) && ec != std::errc::no_such_file_or_directory) {
        log().error("Error deleting file after successful upload");
      }
    } else {
      log().error("{} upload failed with non-200 response code", typeString);
    }
    notifyDelegate(fileURL, status);
    if (completion) completion(std::move(response), std::move(error));
  }
};

UploadManager::UploadManager(FBFAssemblyProtocol& assembly, UploadBuildPredicates predicates,
                             std::shared_ptr<TaskQueue> encoder)
    : assembly_(assembly),
      predicates_(std::move(predicates)),
      uploadSession_(assembly.makeUploadSession()),
      encoder_(std::move(encoder)),
      bag_(assembly.cachedBag()),
      ageLimit_(FeedbackAgeLimit::fromBag(bag_)),
      fileManager_(assembly.fileManager()),
      core_(std::make_shared<Core>(assembly)) {
  if (!predicates_.isSeedBuild) predicates_.isSeedBuild = [] { return vireon_isSeedBuild(); };
  if (!predicates_.isInternalBuild) predicates_.isInternalBuild = [] { return vireon_isInternalBuild(); };
}

UploadManager::~UploadManager() {
  core_->delegate = nullptr;
  if (uploadSession_) uploadSession_->finishTasksAndInvalidate();
}

void UploadManager::setDelegate(UploadManagerDelegate* delegate) { core_->delegate = delegate; }

UploadManagerFactory UploadManager::factory(std::shared_ptr<TaskQueue> encoder) {
  return [encoder](FBFAssemblyProtocol& assembly) -> std::unique_ptr<UploadManagerProtocol> {
    return std::make_unique<UploadManager>(assembly, UploadBuildPredicates{}, encoder);
  };
}

// ---- request formation ----

std::vector<QueryItem> UploadManager::debugQueryItems(std::string_view parameters) {
  std::vector<QueryItem> items;
  for (auto piece : splitDroppingEmpty(parameters, '&')) {
    auto parts = splitDroppingEmpty(piece, '=');
    if (parts.size() == 2) items.push_back({std::string(parts[0]), std::string(parts[1])});
  }
  return items;
}

HttpRequest UploadManager::feedbackUploadRequest(const std::string& url, const std::string& type) {
  // A malformed endpoint from the bag is bad input, not a broken build: it is
  // refused like a non-http(s) one instead of stopping the process.
  auto components = URLComponents::parse(url);
  if (!components) throw VireonURLRequestBuilder::URLError();
  VireonURLRequestBuilder builder(std::move(*components));

  builder.defaultQueryItemWithName("v", "2");
  if (!type.empty()) builder.defaultQueryItemWithName("type", type);
  if (predicates_.isSeedBuild()) builder.defaultQueryItemWithName("seed", "1");
  if (predicates_.isInternalBuild()) builder.defaultQueryItemWithName("internal", "1");
  if (auto debug = assembly_.userDefaults().stringForKey(FBFStrings::Defaults::DebugQueryParameters)) {
    for (auto& item : debugQueryItems(*debug)) builder.forceQueryItem(std::move(item));
  }
  if (assembly_.isFlushingEagerly()) builder.forceQueryItemWithName(std::string(FBFStrings::QueryItems::Realtime), "1");
  builder.defaultHttpHeader(std::string(FBFStrings::HTTPHeaders::UserAgent), assembly_.deviceContext().userAgent());
  builder.defaultHttpHeader(std::string(FBFStrings::HTTPHeaders::ContentEncoding), "deflate");
  builder.defaultQueryItemWithName(std::string(FBFStrings::QueryItems::Key), std::string(kClientKey));

  HttpRequest request = builder.createUrlRequest();
  request.ignoreLocalCache = true;
  request.timeout = kUploadTimeout;
  request.method = "POST";
  // Deliberately asymmetric: the protobuf session type must be spelled
  // exactly, the two protobuf custom types may come in any letter case.
  if (type == FBFStrings::VireonProtobufFeedbackType || equalsIgnoringCase(type, "UserReport") ||
      equalsIgnoringCase(type, "Usage")) {
    setHeader(request, FBFStrings::HTTPHeaders::ContentType, "application/protobuf");
  }
  return request;
}

std::optional<std::string> UploadManager::endpointForCustomType(const ConfigurationBag& bag, const std::string& type) {
  if (type == "Crowdsourcing") {
    if (auto url = bag.crowdsourcingURL()) return url;
  }
  return bag.feedbackURL();
}

// ---- upload files ----

std::optional<fs::path> UploadManager::uploadFileForSession(const SessionFilename& session) const {
  auto dir = cacheDirNoCreate(fileManager_);
  if (!dir) return std::nullopt;
  return *dir / session.uploadFilenameString();
}

std::optional<fs::path> UploadManager::uploadFileForSessionAt(const fs::path& sessionURL, UploadFormat format) const {
  auto name = SessionFilename::fromString(sessionURL.filename().string());
  if (name) name->uploadFormat = format;
  auto fileURL = name ? uploadFileForSession(*name) : std::nullopt;
  if (!fileURL) log().error("Error getting temp file.");
  return fileURL;
}

fs::path UploadManager::uploadFileForCustomFeedback(const fs::path& url) {
  fs::path path = url;
  path += std::string(FBFStrings::UploadPendingSuffix);
  return path;
}

std::optional<std::string> UploadManager::endpointFor(const std::string& type) const {
  if (!bag_) return std::nullopt;
  return endpointForCustomType(*bag_, type);
}

std::optional<HttpRequest> UploadManager::requestFor(const std::string& type) {
  auto endpoint = endpointFor(type);
  if (!endpoint) {
    log().error("feedback uploader found no upload endpoint from defaults.");
    return std::nullopt;
  }
  try {
    return feedbackUploadRequest(*endpoint, type);
  } catch (const VireonURLRequestBuilder::URLError&) {
    log().error("feedbackUploadRequest failed because of bad url.");
    return std::nullopt;
  }
}

bool UploadManager::canFormRequest(const std::string& type) {
  // The bag is fixed for the manager's life, so the answer is too: one check
  // per type, not one per file.
  if (auto known = usableTypes_.find(type); known != usableTypes_.end()) return known->second;
  auto endpoint = endpointFor(type);
  bool usable = false;
  if (endpoint) {
    try {
      feedbackUploadRequest(*endpoint, type);
      usable = true;
    } catch (const VireonURLRequestBuilder::URLError&) {
    }
  }
  if (!usable) log().error("No usable upload endpoint for {} in the bag; its files stay for a later flush.", type);
  usableTypes_.emplace(type, usable);
  return usable;
}

namespace {

struct Compressed {
  int64_t uncompressedSize = 0;
  int64_t compressedSize = 0;
  std::string digest;
};

// Compresses whatever `produce` writes into the upload file at `finalPath`.
// No value when the file cannot be written whole (nothing is left behind).
// Touches only the file manager, so any thread may run it.
std::optional<Compressed> compressInto(FileManager& fm, const fs::path& finalPath,
                                       const std::function<bool(CompressedOutputStream&)>& produce) {
  PartialUploadFile file(fm, finalPath);
  FileDescriptor fd = file.create();
  if (!fd.valid()) {
    log().error("Error getting temp file.");
    return std::nullopt;
  }
  auto fileStream = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(fileStream);
  log().debug("Compressing feedback to {}", finalPath.string());
  stream.open();
  if (fileStream->streamStatus() == StreamStatus::error) {
    log().error("error opening output stream");
    return std::nullopt;
  }
  bool produced = produce(stream);
  stream.close();
  if (!produced) return std::nullopt;
  // The compressing stream does not look at its file's writes; a full disk
  // shows here, and a truncated payload must never be sent.
  if (fileStream->streamStatus() == StreamStatus::error || stream.streamStatus() == StreamStatus::error) {
    log().error("Error writing the upload file {}", finalPath.string());
    return std::nullopt;
  }
  if (!file.commit()) {
    log().error("Error getting temp file.");
    return std::nullopt;
  }
  return Compressed{stream.uncompressedBytesWritten(), stream.compressedBytesWritten(), stream.dataDigestForStream()};
}

UploadRequest finish(HttpRequest request, const fs::path& fileURL, const Compressed& compressed,
                     std::string typeString) {
  setHeader(request, FBFStrings::HTTPHeaders::Digest, compressed.digest);
  return UploadRequest{std::move(request), fileURL, compressed.uncompressedSize, compressed.compressedSize,
                       std::move(typeString), {}};
}

}  // namespace

// ---- preparations ----
// Each forms the request first: a request that cannot be formed leaves no
// compressed copy behind.

struct UploadManager::SessionJob {
  std::string payload;
  UploadFormat format = UploadFormat::pb;
  fs::path fileURL;
  HttpRequest request;
  std::string type;
  // Where a copy of the compressed upload stays (LeaveFeedbackAfterUpload).
  std::optional<fs::path> keepCopyAt;

  // Any thread.
  std::optional<UploadRequest> run(FileManager& fm) {
    auto compressed = compressInto(fm, fileURL, [&](CompressedOutputStream& stream) {
      if (format == UploadFormat::pb) {
        stream.write(reinterpret_cast<const uint8_t*>(payload.data()), payload.size());
      } else {
        // JSON goes in small writes, so its digest is the plain SHA-512.
        CompressedStreamBuf buffer(stream);
        buffer.sputn(payload.data(), static_cast<std::streamsize>(payload.size()));
      }
      return true;
    });
    if (!compressed) return std::nullopt;
    if (keepCopyAt) {
      log().info("Respecting LeaveFeedbackAfterUpload and leaving compressed feedback file {}", fileURL.string());
      std::error_code ec;
      if (!fm.copyItem(fileURL, *keepCopyAt, ec)) {
        log().error("Error copying compressed upload data for LeaveFeedbackAfterUpload {}", fileURL.string());
      }
    }
    log().debug("{} vireon feedback upload to {}", format == UploadFormat::pb ? "Protobuf" : "JSON",
                request.url.empty() ? "unknown?" : request.url);
    return finish(std::move(request), fileURL, *compressed, std::move(type));
  }
};

std::optional<UploadManager::SessionJob> UploadManager::sessionJob(std::string payload, UploadFormat format,
                                                                   const fs::path& sessionURL) {
  SessionJob job;
  job.format = format;
  job.type = format == UploadFormat::pb ? FBFStrings::VireonProtobufFeedbackType : FBFStrings::VireonFeedbackType;
  auto fileURL = uploadFileForSessionAt(sessionURL, format);
  if (!fileURL) return std::nullopt;
  auto request = requestFor(job.type);
  if (!request) return std::nullopt;
  job.fileURL = std::move(*fileURL);
  job.request = std::move(*request);
  if (format == UploadFormat::pb &&
      assembly_.userDefaults().boolForKey(FBFStrings::Defaults::LeaveFeedbackAfterUpload)) {
    if (auto dir = cacheDirNoCreate(fileManager_)) {
      job.keepCopyAt = *dir / (sessionURL.filename().string() + ".deflate");
    } else {
      log().error("Error copying compressed upload data for LeaveFeedbackAfterUpload {}", job.fileURL.string());
    }
  }
  job.payload = std::move(payload);
  return job;
}

void UploadManager::prepareSessionUpload(std::string payload, UploadFormat format, const fs::path& sessionURL,
                                         PreparationCompletion completion) {
  auto job = sessionJob(std::move(payload), format, sessionURL);
  if (!job) {
    completion(std::nullopt);
    return;
  }
  if (!encoder_) {
    completion(job->run(fileManager_));
    return;
  }
  // The completion (and what it keeps alive) moves on to the work queue; the
  // encoder's thread never holds the last reference to it.
  encoder_->async([&fm = fileManager_, &workloop = assembly_.workloop(), job = std::move(*job),
                   completion = std::move(completion)]() mutable {
    auto request = job.run(fm);
    workloop.async([request = std::move(request), completion = std::move(completion)]() mutable {
      completion(std::move(request));
    });
  });
}

std::optional<UploadRequest> UploadManager::uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                                   const fs::path& sessionURL) {
  // Deterministic: the upload is byte for byte what `fbfctl explain` shows.
  auto job = sessionJob(serializeSessionDeterministically(session), UploadFormat::pb, sessionURL);
  return job ? job->run(fileManager_) : std::nullopt;
}

std::optional<UploadRequest> UploadManager::uploadJSONFeedback(const nlohmann::ordered_json& dictionary,
                                                               const fs::path& sessionURL) {
  std::string text;
  try {
    text = dictionary.dump();
  } catch (const nlohmann::json::exception& e) {
    // Strings that are not UTF-8 cannot be written as JSON.
    log().error("Session didn't serialize properly to JSON: {}", e.what());
    return std::nullopt;
  }
  auto job = sessionJob(std::move(text), UploadFormat::json, sessionURL);
  return job ? job->run(fileManager_) : std::nullopt;
}

std::optional<UploadRequest> UploadManager::uploadCustomFeedback(const fs::path& fileURL, const std::string& type) {
  log().debug("Flushing Custom Feedback.");
  auto endpoint = bag_ ? endpointForCustomType(*bag_, type) : std::nullopt;
  if (!endpoint || !knownFeedbackTypeFromName(type, true)) {
    log().error("Feedback endpoint or appropriate type not set, data can't be sent to server.");
    return std::nullopt;
  }
  auto request = requestFor(type);
  if (!request) return std::nullopt;
  log().debug("uploadFile: {}.", fileURL.string());
  std::error_code ec;
  FileDescriptor input = fileManager_.openForReading(fileURL, ec);
  if (!input.valid()) {
    // Links and files that are not ours are never read.
    log().error("Couldn't open custom feedback file {}: {}", fileURL.string(), ec.message());
    return std::nullopt;
  }
  const fs::path outURL = uploadFileForCustomFeedback(fileURL);
  auto compressed = compressInto(fileManager_, outURL, [&](CompressedOutputStream& stream) {
    std::array<uint8_t, 8192> buffer{};
    while (true) {
      ssize_t n = ::read(input.get(), buffer.data(), buffer.size());
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) {
        log().error("Couldn't open custom feedback file {}: {}", fileURL.string(), std::strerror(errno));
        return false;
      }
      if (n == 0) return true;
      stream.write(buffer.data(), static_cast<size_t>(n));
    }
  });
  if (!compressed) return std::nullopt;
  log().debug("Custom upload to {}", request->url);
  return finish(std::move(*request), outURL, *compressed, type);
}

// ---- sending ----

void UploadManager::enqueue(UploadRequest request, UploadCompletion completion) {
  log().debug("Enqueueing {} for upload", request.fileURL.filename().string());
  auto core = core_;
  auto fileURL = request.fileURL;
  auto typeString = request.typeString;
  // Read now, while the file surely exists: the success event needs them.
  auto attributes = fileManager_.attributes(fileURL);
  ++core->inFlight;
  if (!uploadSession_) {
    HttpError error{HttpErrorDomain::other, HttpErrorCode::other, "no upload session is available"};
    log().error("{} upload failed: {}", typeString, error.description);
    assembly_.workloop().async(
        [core, fileURL, attributes, typeString, error, completion = std::move(completion)]() mutable {
          core->taskDidComplete(fileURL, attributes, typeString, std::nullopt, error, completion);
        });
    return;
  }
  // Once the server has accepted the payload, every moment its files stay is
  // a moment in which a crash would send it again; the work queue may be busy
  // with a large file, so they go from the session's own thread.
  std::vector<fs::path> acceptedFiles = std::move(request.removeOnAcceptance);
  acceptedFiles.push_back(fileURL);
  request.request.onStatus = [&fm = fileManager_, acceptedFiles = std::move(acceptedFiles)](long status) {
    if (status != 200) return;
    for (const auto& file : acceptedFiles) {
      std::error_code ec;
      fm.removeItem(file, ec);
    }
  };
  uploadSession_->uploadFile(
      std::move(request.request), request.fileURL,
      [core, fileURL, attributes, typeString, completion = std::move(completion)](std::optional<HttpResponse> response,
                                                                                  std::optional<HttpError> error) {
        core->taskDidComplete(fileURL, attributes, typeString, std::move(response), std::move(error), completion);
      });
}

size_t UploadManager::uploadsInFlight() const { return core_->inFlight; }

void UploadManager::retryUpload(const fs::path& fileURL, const std::string& typeString) {
  // A file whose creation date cannot be read counts as too old.
  auto attributes = fileManager_.attributes(fileURL);
  if (attributes && ageLimit_.allows(attributes->creationDate, assembly_.currentDate())) {
    auto endpoint = endpointFor(typeString);
    if (!endpoint) {
      log().error("feedback uploader found no upload endpoint from defaults.");
      return;
    }
    log().debug("Retry upload of {}.", fileURL.filename().string());
    HttpRequest request;
    try {
      request = feedbackUploadRequest(*endpoint, typeString);
    } catch (const VireonURLRequestBuilder::URLError&) {
      log().error("Bad upload url");
      return;
    }
    enqueue(UploadRequest::retryRequest(std::move(request), fileURL, typeString), nullptr);
    return;
  }

  if (auto event = FeedbackDeletionEvent::make(fileURL, feedbackTypeCode(typeString), FeedbackDeletionReason::tooOld,
                                               assembly_.currentDate(), fileManager_)) {
    assembly_.didDeleteFeedbackFile(*event);
  }
  log().info("Discarding rather than retrying upload because file is too old: {}.", fileURL.filename().string());
  std::error_code ec;
  if (!fileManager_.removeItem(fileURL, ec)) log().error("error removing session file");
}

}  // namespace fbf
