// An upload manager that prepares requests without compressing and holds
// every enqueued upload until the test settles it, so a test decides when
// (and how) each upload ends.
#pragma once

#include "flushing/session_filename.h"
#include "flushing/upload_manager_protocol.h"
#include "corevireon.pb.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <deque>
#include <set>
#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace fbf::testing {

class FakeUploadManager final : public UploadManagerProtocol {
 public:
  using Prepared = std::pair<fs::path, std::string>;  // (source or upload file, type)
  struct Log {
    std::set<Prepared> prepared, retried;
    std::deque<std::pair<UploadRequest, UploadCompletion>> pending;
    std::function<void()> onEnqueue;  // called while the flusher is still in enqueue
  };

  explicit FakeUploadManager(std::shared_ptr<Log> log) : log_(std::move(log)) {}

  std::optional<UploadRequest> uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                      const fs::path& sessionURL) override {
    auto parsed = SessionFilename::fromString(sessionURL.filename().string());
    if (!parsed) return std::nullopt;
    parsed->uploadFormat = UploadFormat::pb;
    return prepared(sessionURL, sessionURL.parent_path() / parsed->uploadFilenameString(), session.ByteSizeLong(),
                    "FeedbackV2PB");
  }
  // These tests run with the protobuf format only.
  std::optional<UploadRequest> uploadJSONFeedback(const nlohmann::ordered_json&, const fs::path&) override {
    ADD_FAILURE() << "unexpected JSON upload";
    return std::nullopt;
  }
  std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) override {
    return prepared(fileURL, fs::path(fileURL.string() + ".uploadPending"), fs::file_size(fileURL), type);
  }
  void enqueue(UploadRequest request, UploadCompletion completion) override {
    log_->pending.emplace_back(std::move(request), std::move(completion));
    if (log_->onEnqueue) log_->onEnqueue();
  }
  void retryUpload(const fs::path& fileURL, const std::string& type) override {
    log_->retried.emplace(fileURL, type);
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
  // Logs the preparation; the upload file exists, as the real manager's would.
  std::optional<UploadRequest> prepared(const fs::path& source, fs::path uploadFile, uint64_t size,
                                        const std::string& type) {
    log_->prepared.emplace(source, type);
    if (FILE* f = std::fopen(uploadFile.c_str(), "w")) std::fclose(f);
    return UploadRequest{{}, std::move(uploadFile), static_cast<int64_t>(size), static_cast<int64_t>(size / 2), type, {}};
  }

  std::shared_ptr<Log> log_;
  UploadManagerDelegate* delegate_ = nullptr;
};

}  // namespace fbf::testing
