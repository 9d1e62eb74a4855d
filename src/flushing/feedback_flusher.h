// One flush: walks the pending session and custom feedback files one at a
// time on the work queue, checks each against the age and size limits,
// post-processes sessions for privacy, hands payloads to the upload manager,
// and at the end flushes the cohort feedback, prunes the session directory
// and calls its completion exactly once.
//
// The completion comes when the walk has finished AND every upload the flush
// enqueued has reached its outcome, so a client that asked for a flush knows
// the data has really gone (or not). Files that cannot be sent stay on disk
// for the next flush; every file the flusher drops is reported as a deletion
// event first.
//
// Lives on the assembly's work queue; made and kept by a shared_ptr (pending
// work holds it alive). `stopEnumeratingFeedback` may be called from any
// thread.
#pragma once

#include "assembly/fbf_assembly_protocol.h"
#include "flushing/feedback_enumerator.h"
#include "flushing/upload_manager_protocol.h"
#include "util/signpost.h"

#include <atomic>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace fbf {

class UsageEventSink;

// The usage store as one flush uses it; absent when the store cannot be
// brought up (then no usage is counted and no cohorts are generated).
class FlushUsageStore {
 public:
  virtual ~FlushUsageStore() = default;
  virtual UsageEventSink* usageEventSink() = 0;
  // At the end of the walk: every due period aggregated into "Usage" files.
  virtual void flushCohortsFeedback() = 0;
  // When the flusher goes away.
  virtual void resetRowCache() = 0;
};

struct FlusherDependencies {
  UploadManagerFactory uploadManagerFactory;
  // Optional.
  std::function<std::unique_ptr<FlushUsageStore>(FBFAssemblyProtocol&)> usageStoreFactory;
  // Injectable for tests; the system draw by default.
  RandomChoice randomChoice = systemRandomChoice();
};

class FeedbackFlusher final : public UploadManagerDelegate, public std::enable_shared_from_this<FeedbackFlusher> {
 public:
  static constexpr int kMaximumNumberOfFeedbackFiles = 100;

  static std::shared_ptr<FeedbackFlusher> make(FBFAssemblyProtocol& assembly, FlusherDependencies deps);
  ~FeedbackFlusher() override;

  // An empty list flushes every type (and the session files).
  void beginEnumeratingFeedback(std::vector<std::string> types, std::function<void()> completion);
  void beginEnumeratingFeedback(std::function<void()> completion) { beginEnumeratingFeedback({}, std::move(completion)); }
  // The walk ends after the file in progress.
  void stopEnumeratingFeedback();
  // Processes one session file now (a closed one is processed, one left with
  // an upload suffix is retried), then completes.
  void flushSessionEagerly(const fs::path& url, std::function<void()> completion);

  void uploadManagerDidUploadFile(const fs::path& file, long status) override;

  // Limits from the bag the flusher was made with.
  int64_t feedbackMaxAgeInDays() const;
  uint64_t sizeLimitFor(const std::string& type) const;
  static const std::vector<std::string>& customFeedbackTypesWithPrivacyExceptions();

 private:
  FeedbackFlusher(FBFAssemblyProtocol& assembly, FlusherDependencies deps);

  void flushNext();
  void flushFeedbackFile(const FeedbackFile& file);
  void postProcessAndUpload(const FeedbackFile& file);
  void validateAndUploadCustomFeedback(const FeedbackFile& file);
  void retryPendingUpload(const FeedbackFile& file);
  void enqueue(UploadRequest request, uint64_t fileSize);
  void tee(const std::string& payload, const std::string& format);
  void discardFeedback(const fs::path& file, int typeCode, int32_t reason,
                       std::string_view failureMessage = "error removing feedback file");
  bool createdWithinMaxAge(SystemTime creation) const;
  void enumeratingFeedbackDidFinish();
  void pruneSessionFiles(int maximum);
  void completeWhenUploadsSettle();

  FBFAssemblyProtocol& assembly_;
  FlusherDependencies deps_;
  std::optional<ConfigurationBag> bag_;
  std::unique_ptr<UploadManagerProtocol> uploadManager_;
  std::unique_ptr<FlushUsageStore> usageStore_;
  std::optional<FeedbackEnumerator> feedbackEnumerator_;
  std::function<void()> enumerationCompletion_;
  std::unique_ptr<SignpostInterval> flushInterval_;
  bool walkFinished_ = false;
  std::set<fs::path> enqueuedFiles_;
  std::atomic<bool> stopRequested_{false};
};

}  // namespace fbf
