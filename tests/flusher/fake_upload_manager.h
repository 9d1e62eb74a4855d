// An upload manager that prepares requests without compressing and holds
// every enqueued upload until the test settles it, so a test decides when
// (and how) each upload ends.
#pragma once

#include "flushing/session_filename.h"
#include "flushing/upload_manager_protocol.h"
#include "corevireon.pb.h"

#include <cstdio>
#include <deque>
#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace fbf::testing {

class FakeUploadManager final : public UploadManagerProtocol {
 public:
  using Prepared = std::pair<fs::path, std::string>;  // (source or upload file, type)
  struct Log {
    std::vector<Prepared> prepared, retried;
    std::deque<std::pair<UploadRequest, UploadCompletion>> pending;
    std::function<void()> onEnqueue;  // called while the flusher is still in enqueue
  };

  explicit FakeUploadManager(std::shared_ptr<Log> log) : log_(std::move(log)) {}

  std::optional<UploadRequest> uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                      const fs::path& sessionURL) override {
    return session_(sessionURL, session.ByteSizeLong(), "FeedbackV2PB");
  }
  std::optional<UploadRequest> uploadJSONFeedback(const nlohmann::ordered_json& dictionary,
                                                  const fs::path& sessionURL) override {
    return session_(sessionURL, dictionary.dump().size(), "FeedbackV2");
  }
  std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) override {
    log_->prepared.emplace_back(fileURL, type);
    std::error_code ec;
    const auto size = fs::file_size(fileURL, ec);
    return prepared(fs::path(fileURL.string() + ".uploadPending"), ec ? 0 : size, type);
  }
  void enqueue(UploadRequest request, UploadCompletion completion) override {
    log_->pending.emplace_back(std::move(request), std::move(completion));
    if (log_->onEnqueue) log_->onEnqueue();
  }
  void retryUpload(const fs::path& fileURL, const std::string& type) override {
    log_->retried.emplace_back(fileURL, type);
  }
  size_t uploadsInFlight() const override { return log_->pending.size(); }
  void setDelegate(UploadManagerDelegate* delegate) override { delegate_ = delegate; }

  // Ends the oldest pending upload with `status` (0: no HTTP response) as the
  // real manager does: the count drops, then the completion and the delegate
  // hear of it. Must run on the work queue's thread.
  void settleOldest(long status) {
    auto [request, completion] = std::move(log_->pending.front());
    log_->pending.pop_front();
    if (status == 200) fs::remove(request.fileURL);
    std::optional<HttpResponse> response;
    if (status != 0) response = HttpResponse{status, {}};
    if (completion) completion(response, status != 0 ? std::nullopt : std::optional<HttpError>(HttpError{}));
    if (delegate_) delegate_->uploadManagerDidUploadFile(request.fileURL, status);
  }

 private:
  std::optional<UploadRequest> session_(const fs::path& sessionURL, uint64_t size, const char* type) {
    auto parsed = SessionFilename::fromString(sessionURL.filename().string());
    if (!parsed) return std::nullopt;
    parsed->uploadFormat = std::string_view(type) == "FeedbackV2PB" ? UploadFormat::pb : parsed->uploadFormat;
    log_->prepared.emplace_back(sessionURL, type);
    return prepared(sessionURL.parent_path() / parsed->uploadFilenameString(), size, type);
  }
  // The upload file exists, as the real manager's would.
  static std::optional<UploadRequest> prepared(fs::path uploadFile, uint64_t size, const std::string& type) {
    if (FILE* f = std::fopen(uploadFile.c_str(), "w")) std::fclose(f);
    return UploadRequest{{}, std::move(uploadFile), static_cast<int64_t>(size), static_cast<int64_t>(size / 2), type, {}};
  }

  std::shared_ptr<Log> log_;
  UploadManagerDelegate* delegate_ = nullptr;
};

}  // namespace fbf::testing
