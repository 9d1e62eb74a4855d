#include "flushing/feedback_flusher.h"

#include "assembly/cache_paths.h"
#include "assembly/fbf_strings.h"
#include "assembly/feedback_types.h"
#include "corevireon.pb.h"
#include "flushing/cache_layout.h"
#include "flushing/flushable_session.h"
#include "flushing/session_payload.h"
#include "flushing/session_recovery.h"
#include "platform/logging.h"

#include <algorithm>

#include <unistd.h>

namespace fbf {
namespace {

spdlog::logger& log() { return logging::get("FeedbackFlusher"); }

std::optional<std::string> readWholeFile(FileManager& fm, const fs::path& path) {
  std::error_code ec;
  return fm.readFile(path, ec);
}

}  // namespace

std::shared_ptr<FeedbackFlusher> FeedbackFlusher::make(FBFAssemblyProtocol& assembly, FlusherDependencies deps) {
  return std::shared_ptr<FeedbackFlusher>(new FeedbackFlusher(assembly, std::move(deps)));
}

FeedbackFlusher::FeedbackFlusher(FBFAssemblyProtocol& assembly, FlusherDependencies deps)
    : assembly_(assembly),
      deps_(std::move(deps)),
      bag_(assembly.cachedBag()),
      ageLimit_(FeedbackAgeLimit::fromBag(bag_)),
      leaveFeedbackAfterUpload_(assembly.userDefaults().boolForKey(FBFStrings::Defaults::LeaveFeedbackAfterUpload)) {
  if (deps_.uploadManagerFactory) uploadManager_ = deps_.uploadManagerFactory(assembly_);
  if (uploadManager_) uploadManager_->setDelegate(this);
}

FeedbackFlusher::~FeedbackFlusher() {
  if (uploadManager_) uploadManager_->setDelegate(nullptr);
  if (usageStore_) {
    usageStore_->resetRowCache();
    log().debug("Emptied the ObjectGraph row cache.");
  }
}

const std::vector<std::string>& FeedbackFlusher::customFeedbackTypesWithPrivacyExceptions() {
  // A report the user chose to send carries its own consent.
  static const std::vector<std::string> types = {"UserReport"};
  return types;
}

uint64_t FeedbackFlusher::sizeLimitFor(const std::string& type) const {
  if (bag_) {
    auto sizes = bag_->maxCustomFeedbackSizes();
    if (auto it = sizes.find(type); it != sizes.end()) return it->second;
  }
  return FBFConstants::DefaultMaxSessionFileSize;
}

bool FeedbackFlusher::createdWithinMaxAge(SystemTime creation) const {
  return ageLimit_.allows(creation, assembly_.currentDate());
}

void FeedbackFlusher::beginEnumeratingFeedback(std::vector<std::string> types, std::function<void()> completion) {
  auto self = shared_from_this();
  assembly_.workloop().async([self, types = std::move(types), completion = std::move(completion)]() mutable {
    self->enumerationCompletion_ = std::move(completion);
    self->pruneWhenSettled_ = true;
    self->flushInterval_ = std::make_unique<SignpostInterval>("flush");
    // An offline cancellation ends the flush it happened in, not this one.
    if (self->assembly_.isCancelled() && !self->assembly_.isTerminating()) self->assembly_.setCancelled(false);
    if (self->bag_) {
      vireon_cleanup(self->assembly_.fileManager(), self->assembly_.currentDate());
      if (self->deps_.usageStoreFactory) self->usageStore_ = self->deps_.usageStoreFactory(self->assembly_);
      self->poisonSessionIDs_ = interruptedSessionIDs(self->assembly_.fileManager());
      self->collectPendingUploads(types);
    }
    self->feedbackEnumerator_ = FeedbackEnumerator::make(self->assembly_, std::move(types), self->deps_.randomChoice);
    if (!self->feedbackEnumerator_) log().error("Cannot locate the cache directory; nothing to flush");
    self->flushNext();
  });
}

void FeedbackFlusher::stopEnumeratingFeedback() {
  stopRequested_ = true;
  auto self = shared_from_this();
  assembly_.workloop().async([self] {
    if (self->feedbackEnumerator_) self->feedbackEnumerator_->finish();
    // A walk waiting for room ends now rather than at the next completion.
    if (self->walkWaiting_) {
      self->walkWaiting_ = false;
      self->enumeratingFeedbackDidFinish();
    }
  });
}

void FeedbackFlusher::flushNext() {
  auto self = shared_from_this();
  assembly_.workloop().async([self] {
    if (!self->bag_) {
      log().info("Flusher didn't find a cached bag, bailing on this flush");
      self->enumeratingFeedbackDidFinish();
      return;
    }
    if (!self->feedbackEnumerator_ || self->stopRequested_ || !self->assembly_.shouldProceed()) {
      self->enumeratingFeedbackDidFinish();
      return;
    }
    if (!self->hasRoom()) {
      // Resumed by the next preparation's or upload's completion.
      self->walkWaiting_ = true;
      return;
    }
    auto file = self->nextFile();
    if (!file) {
      self->enumeratingFeedbackDidFinish();
      return;
    }
    self->flushFeedbackFile(*file);
    self->flushNext();
  });
}

std::optional<FeedbackFile> FeedbackFlusher::nextFile() {
  if (!pendingUploads_.empty()) {
    FeedbackFile file = std::move(pendingUploads_.front());
    pendingUploads_.pop_front();
    return file;
  }
  while (auto file = feedbackEnumerator_->next()) {
    // Every upload file the walk meets was either retried above or made by
    // this flush.
    if (!file->uploadPending()) return file;
  }
  return std::nullopt;
}

void FeedbackFlusher::collectPendingUploads(const std::vector<std::string>& types) {
  auto& fm = assembly_.fileManager();
  std::vector<std::pair<SystemTime, FeedbackFile>> found;
  if (types.empty()) {
    for (auto& entry : sessionFilesAwaitingUpload(fm)) {
      found.emplace_back(entry.attributes.creationDate, FeedbackFile(entry.path, entry.attributes));
    }
  }
  if (auto custom = customFeedbackDir(fm)) {
    for (const auto& type : allCustomFeedbackDirectories()) {
      if (!types.empty() && std::find(types.begin(), types.end(), type) == types.end()) continue;
      auto walk = fm.enumerate(*custom / type);
      if (!walk) continue;
      while (auto e = walk->next()) {
        if (!e->attributes.isRegular() || e->attributes.owner != geteuid()) continue;
        if (!e->name.ends_with(FBFStrings::UploadPendingSuffix) || e->name.starts_with(".")) continue;
        found.emplace_back(e->attributes.creationDate, FeedbackFile(e->path, e->attributes));
      }
    }
  }
  std::stable_sort(found.begin(), found.end(), [](const auto& a, const auto& b) { return a.first < b.first; });
  for (auto& [date, file] : found) pendingUploads_.push_back(std::move(file));
}

void FeedbackFlusher::flushFeedbackFile(const FeedbackFile& file) {
  if (file.uploadPending()) {
    retryPendingUpload(file);
  } else if (file.fileType == FeedbackFileType::session) {
    // Open files belong to a writer; uploaded ones are left as they are, and
    // processing ones belong to this flush or to start-up recovery.
    if (!file.sessionFilename) return;
    if (file.sessionFilename->state == SessionFileState::closed) {
      postProcessAndUpload(file);
    } else if (file.sessionFilename->state == SessionFileState::processing) {
      checkAgeOfPoisonFile(file);
    }
  } else if (file.fileType == FeedbackFileType::custom) {
    validateAndUploadCustomFeedback(file);
  }
}

void FeedbackFlusher::checkAgeOfPoisonFile(const FeedbackFile& file) {
  if (!poisonSessionIDs_.count(file.sessionFilename->sessionIDString())) return;
  auto attrs = file.attributes ? file.attributes : assembly_.fileManager().attributes(file.fileURL);
  if (!attrs || createdWithinMaxAge(attrs->creationDate)) return;
  log().info("Discarding session because it's too old: {}.", file.fileName());
  discardFeedback(file.fileURL, *knownFeedbackTypeFromName(FBFStrings::VireonProtobufFeedbackType),
                  FeedbackDeletionReason::tooOld);
}

void FeedbackFlusher::retryPendingUpload(const FeedbackFile& file) {
  if (assembly_.isCancelled()) {
    log().debug("Flushing is cancelled, skipping {}.", file.fileName());
    return;
  }
  if (!uploadManager_) return;
  // A retry that was sent is in flight until its outcome; pruning must leave
  // it alone until then.
  const size_t before = uploadManager_->uploadsInFlight();
  uploadManager_->retryUpload(file.fileURL, file.typeString());
  if (uploadManager_->uploadsInFlight() > before) queuedUploads_.insert(file.fileURL);
}

void FeedbackFlusher::returnToClosed(const fs::path& processing) {
  std::error_code ec;
  if (vireon_renameForStateChange(assembly_.fileManager(), processing, SessionFileState::closed, ec)) {
    log().info("Returned {} to closed for a later flush.", processing.filename().string());
  } else {
    log().error("Error trying to move file {} back to closed state: {}", processing.string(), ec.message());
  }
}

void FeedbackFlusher::postProcessAndUpload(const FeedbackFile& file) {
  auto& fm = assembly_.fileManager();
  const bool protobufFormat = bag_ && bag_->vireonFeedbackFormat() == FBFStrings::VireonProtobufFeedbackType;
  const std::string typeString(protobufFormat ? FBFStrings::VireonProtobufFeedbackType : FBFStrings::VireonFeedbackType);
  // Without a usable endpoint the session is not claimed: it stays closed.
  if (!uploadManager_ || !uploadManager_->canFormRequest(typeString)) return;

  std::error_code ec;
  auto processing = vireon_renameForStateChange(fm, file.fileURL, SessionFileState::processing, ec);
  if (!processing) {
    log().error("Error trying to move file {} to processing state: {}", file.fileURL.string(), ec.message());
    return;
  }
  const fs::path path = *processing;
  const std::string name = path.filename().string();

  auto attrs = fm.attributes(path);
  if (!attrs) {
    log().error("Couldn't retrieve file attributes for session {}.", name);
    if (!fm.removeItem(path, ec)) log().error("Couldn't get file attributes but deletion failed");
    return;
  }
  const int protobufType = *knownFeedbackTypeFromName(FBFStrings::VireonProtobufFeedbackType);
  if (!createdWithinMaxAge(attrs->creationDate)) {
    log().info("Discarding session because it's too old: {}.", name);
    discardFeedback(path, protobufType, FeedbackDeletionReason::tooOld);
    return;
  }
  const uint64_t rawLimit = sizeLimitFor(std::string(FBFStrings::VireonProtobufFeedbackType));
  if (attrs->size > rawLimit) {
    log().info("Discarding vireon session {} because size exceeds maximum size {}KB", name, rawLimit / 1024);
    discardFeedback(path, protobufType, FeedbackDeletionReason::tooLarge, "File's too large but deletion failed");
    return;
  }

  auto bytes = readWholeFile(fm, path);
  if (!bytes) {
    log().error("Couldn't open file for reading.");
    returnToClosed(path);
    return;
  }

  std::string payload;
  {
    std::string guid = file.sessionFilename ? file.sessionFilename->sessionIDString() : name;
    SignpostInterval serialize("serialize session", ("file GUID:" + guid).c_str());
    // Undecodable and empty sessions stay in "processing": they are the
    // file's own fault, and `fbfctl status` shows them.
    std::optional<FlushableSession> decoded = FlushableSession::decode(*bytes);
    if (!decoded) {
      log().error("File contents did not deserialize into a _CVClientSession");
      return;
    }
    bytes.reset();
    FlushableSession& flushable = *decoded;
    if (!flushable.hasFeedback()) {
      log().error("Deserialized session contained no feedback.");
      return;
    }
    flushable.postProcessFeedback(usageStore_ ? usageStore_->usageEventSink() : nullptr);
    if (protobufFormat) {
      // Deterministic: the upload is byte for byte what `fbfctl explain` shows.
      payload = serializeSessionDeterministically(flushable.backingStore());
    } else {
      try {
        payload = flushable.generateSessionJSON().dump();
      } catch (const nlohmann::json::exception& e) {
        // Strings that are not UTF-8 cannot be written as JSON.
        log().error("Session didn't serialize properly to JSON: {}", e.what());
        returnToClosed(path);
        return;
      }
    }
  }
  tee(payload, typeString);

  // The work queue goes on with the next file while this one is compressed.
  ++preparationsInFlight_;
  auto self = shared_from_this();
  uploadManager_->prepareSessionUpload(
      std::move(payload), protobufFormat ? UploadFormat::pb : UploadFormat::json, path,
      [self, path, typeString, fileSize = attrs->size](std::optional<UploadRequest> request) {
        --self->preparationsInFlight_;
        self->sessionUploadPrepared(path, typeString, fileSize, std::move(request));
        self->resumeWalk();
      });
}

void FeedbackFlusher::sessionUploadPrepared(const fs::path& path, const std::string& typeString, uint64_t fileSize,
                                            std::optional<UploadRequest> request) {
  if (!request) {
    // No upload file was made (no space, no endpoint, ...): try again later.
    returnToClosed(path);
    return;
  }
  // The processed payload has its own limit under its feedback type.
  const uint64_t processedLimit = sizeLimitFor(typeString);
  if (static_cast<uint64_t>(request->uncompressedSize) > processedLimit) {
    log().info("Discarding vireon session {} because size exceeds maximum size {}KB", path.filename().string(),
               processedLimit / 1024);
    vireon_removeItemOrLogError(assembly_.fileManager(), request->fileURL, "error removing upload file");
    discardFeedback(path, *knownFeedbackTypeFromName(FBFStrings::VireonProtobufFeedbackType),
                    FeedbackDeletionReason::tooLarge);
    return;
  }
  SignpostInterval upload("upload");
  // The payload now lives in the upload file; the session file goes once
  // that is safe.
  enqueue(std::move(*request), fileSize, path);
}

void FeedbackFlusher::validateAndUploadCustomFeedback(const FeedbackFile& file) {
  auto& fm = assembly_.fileManager();
  const std::string type = file.typeString();
  const int typeCode = file.knownFeedbackType();
  log().debug("Flushing {}.", type);
  std::error_code ec;
  auto attrs = fm.attributes(file.fileURL);
  if (!attrs) {
    if (!fm.removeItem(file.fileURL, ec) && fm.exists(file.fileURL)) {
      log().error("Couldn't get file attributes but deletion failed");
    }
    return;
  }
  if (attrs->size == 0) {
    log().info("discarding {} custom feedback because it's empty", type);
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::empty);
    return;
  }
  if (attrs->size > sizeLimitFor(type)) {
    log().info("discarding {} custom feedback because it's too big", type);
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::tooLarge);
    return;
  }
  if (!createdWithinMaxAge(attrs->creationDate)) {
    log().info("Discarding custom feedback because it's too old: {}.", file.fileName());
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::tooOld);
    return;
  }
  const auto& exceptions = customFeedbackTypesWithPrivacyExceptions();
  if (!assembly_.isDiagnosticsAndUsageEnabled() &&
      std::find(exceptions.begin(), exceptions.end(), type) == exceptions.end()) {
    log().info("Skipping custom feedback upload because D&U disabled: {}.", file.fileName());
    discardFeedback(file.fileURL, typeCode, FeedbackDeletionReason::noConsent);
    return;
  }
  // Without a usable endpoint the file stays where it is.
  if (!uploadManager_ || !uploadManager_->canFormRequest(type)) return;
  if (assembly_.uploadListener()) {
    if (auto bytes = readWholeFile(fm, file.fileURL)) tee(*bytes, type);
  }
  auto request = uploadManager_->uploadCustomFeedback(file.fileURL, type);
  if (!request) return;
  enqueue(std::move(*request), attrs->size, file.fileURL);
}

void FeedbackFlusher::tee(const std::string& payload, const std::string& format) {
  // A listener sees what is about to be sent.
  if (auto listener = assembly_.uploadListener()) listener->willUploadData(payload, format);
}

void FeedbackFlusher::enqueue(UploadRequest request, uint64_t fileSize, const fs::path& source) {
  auto self = shared_from_this();
  queuedUploads_.insert(request.fileURL);
  sourcesAwaitingSafety_[request.fileURL] = source;
  if (!leaveFeedbackAfterUpload_ || !SessionFilename::fromString(source.filename().string())) {
    request.removeOnAcceptance.push_back(source);
  }
  std::string type = request.typeString;
  auto size = static_cast<unsigned long>(request.uncompressedSize);
  auto compressed = static_cast<unsigned long>(request.compressedSize);
  uploadManager_->enqueue(std::move(request), [self, type, fileSize, size, compressed](
                                                  std::optional<HttpResponse> response, std::optional<HttpError>) {
    if (response && response->statusCode == 200) {
      log().debug("uploaded {}", size);
    } else {
      log().debug("error");
    }
    vireon_signpost_feedbackUpload(type.c_str(), static_cast<unsigned long>(fileSize), size, compressed);
  });
  if (sourcesAwaitingSafety_.size() >= kSessionRemovalBatch) syncAndRetireSources();
}

void FeedbackFlusher::retireSource(const fs::path& source) {
  auto& fm = assembly_.fileManager();
  std::error_code ec;
  auto name = SessionFilename::fromString(source.filename().string());
  // Gone already when the upload's acceptance removed it.
  auto failed = [&] { return !fm.removeItem(source, ec) && ec != std::errc::no_such_file_or_directory; };
  if (!name) {
    if (failed()) log().error("Error removing custom feedback file after enqueuing it for upload.");
    return;
  }
  if (leaveFeedbackAfterUpload_) return;  // renamed to "uploaded" on its 200
  if (failed()) log().error("Error removing session file after flush");
}

void FeedbackFlusher::syncAndRetireSources() {
  if (sourcesAwaitingSafety_.empty()) return;
  auto& fm = assembly_.fileManager();
  std::error_code ec;
  auto dir = cacheDirNoCreate(fm);
  // One sync for the batch: every upload file written so far is on disk
  // before any of its sources goes. Where the file system cannot sync there
  // is nothing better to wait for.
  if (dir && !fm.syncFileSystem(*dir, ec)) log().debug("Cannot sync the cache file system: {}", ec.message());
  for (const auto& [upload, source] : sourcesAwaitingSafety_) retireSource(source);
  sourcesAwaitingSafety_.clear();
}

void FeedbackFlusher::discardFeedback(const fs::path& file, int typeCode, int32_t reason,
                                      std::string_view failureMessage) {
  auto& fm = assembly_.fileManager();
  // Built before the removal: it needs the file's size and age.
  auto event = FeedbackDeletionEvent::make(file, typeCode, reason, assembly_.currentDate(), fm);
  std::error_code ec;
  if (!fm.removeItem(file, ec)) {
    log().error("{}: {}", failureMessage, ec.message());
    return;
  }
  if (event) assembly_.didDeleteFeedbackFile(*event);
}

void FeedbackFlusher::enumeratingFeedbackDidFinish() {
  if (walkFinished_) return;
  walkWaiting_ = false;
  // Files still being compressed are enqueued, and their sources retired,
  // before the walk counts as finished.
  walkEnding_ = preparationsInFlight_ > 0;
  if (walkEnding_) return;
  walkFinished_ = true;
  log().debug("flush complete, cleaning up");
  flushInterval_.reset();
  syncAndRetireSources();
  if (usageStore_) usageStore_->flushCohortsFeedback();
  feedbackEnumerator_.reset();
  pendingUploads_.clear();
  completeWhenUploadsSettle();
}

void FeedbackFlusher::pruneSessionFiles(int maximum) {
  auto& fm = assembly_.fileManager();
  vireon_pruneSessionFiles(
      fm, maximum,
      [this, &fm](const fs::path& file) {
        auto parsed = SessionFilename::fromString(file.filename().string());
        std::string type(parsed ? queryParameterString(parsed->uploadFormat) : FBFStrings::VireonFeedbackType);
        int code = knownFeedbackTypeFromName(type).value_or(0);
        if (auto event =
                FeedbackDeletionEvent::make(file, code, FeedbackDeletionReason::pruned, assembly_.currentDate(), fm)) {
          assembly_.didDeleteFeedbackFile(*event);
        }
      },
      [this](const fs::path& file) { return queuedUploads_.count(file) > 0; });
}

void FeedbackFlusher::uploadManagerDidUploadFile(const fs::path& file, long status) {
  if (status == 200) {
    queuedUploads_.erase(file);
    auto& fm = assembly_.fileManager();
    if (auto node = sourcesAwaitingSafety_.extract(file); !node.empty()) retireSource(node.mapped());
    // The session a delivered upload came from, kept for inspection.
    auto name = SessionFilename::fromString(file.filename().string());
    if (leaveFeedbackAfterUpload_ && name) {
      name->uploadPending = false;
      fs::path session = file.parent_path() / name->filenameString();
      std::error_code ec;
      if (fm.exists(session) && !vireon_renameForStateChange(fm, session, SessionFileState::uploaded, ec)) {
        log().error("Error trying to move file to uploaded state for LeaveFeedbackAfterUpload: {}", ec.message());
      }
    }
  }
  resumeWalk();
  if (walkFinished_) completeWhenUploadsSettle();
}

bool FeedbackFlusher::hasRoom() const {
  const size_t uploads = uploadManager_ ? uploadManager_->uploadsInFlight() : 0;
  return preparationsInFlight_ < kMaximumPreparations && uploads + preparationsInFlight_ < kMaximumUploadsInFlight;
}

void FeedbackFlusher::resumeWalk() {
  if (walkWaiting_ && hasRoom()) {
    walkWaiting_ = false;
    flushNext();
  } else if (walkEnding_ && preparationsInFlight_ == 0) {
    enumeratingFeedbackDidFinish();
  }
}

void FeedbackFlusher::completeWhenUploadsSettle() {
  if (!enumerationCompletion_) return;
  if (uploadManager_ && uploadManager_->uploadsInFlight() > 0) return;
  if (pruneWhenSettled_ && bag_) {
    pruneWhenSettled_ = false;
    pruneSessionFiles(kMaximumNumberOfFeedbackFiles);
  }
  auto completion = std::move(enumerationCompletion_);
  enumerationCompletion_ = nullptr;
  completion();
}

void FeedbackFlusher::flushSessionEagerly(const fs::path& url, std::function<void()> completion) {
  auto self = shared_from_this();
  assembly_.workloop().async([self, url, completion = std::move(completion)]() mutable {
    self->enumerationCompletion_ = std::move(completion);
    if (self->assembly_.isCancelled() && !self->assembly_.isTerminating()) self->assembly_.setCancelled(false);
    auto attrs = self->assembly_.fileManager().attributes(url);
    if (!self->bag_) {
      log().info("Flusher didn't find a cached bag, bailing on this flush");
    } else if (attrs && attrs->isRegular()) {
      self->flushFeedbackFile(FeedbackFile(url, attrs));
    }
    self->enumeratingFeedbackDidFinish();
  });
}

}  // namespace fbf
