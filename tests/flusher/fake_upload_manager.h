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
  struct Enqueued {
    UploadRequest request;
    UploadCompletion completion;
  };
  // What the flusher asked for, in order.
  struct Log {
    std::vector<std::pair<fs::path, std::string>> prepared;  // (source, type)
    std::vector<std::pair<fs::path, std::string>> retried;   // (upload file, type)
    std::vector<std::string> protobufPayloads;               // serialised sessions
    std::deque<Enqueued> pending;
    size_t settled = 0;
    // Called after each enqueue, while the flusher is still in its call.
    std::function<void()> onEnqueue;
  };

  explicit FakeUploadManager(std::shared_ptr<Log> log) : log_(std::move(log)) {}

  std::optional<UploadRequest> uploadProtobufFeedback(const corevireon::CVClientSession& session,
                                                      const fs::path& sessionURL) override {
    auto parsed = SessionFilename::fromString(sessionURL.filename().string());
    if (!parsed) return std::nullopt;
    parsed->uploadFormat = UploadFormat::pb;
    log_->prepared.emplace_back(sessionURL, "FeedbackV2PB");
    log_->protobufPayloads.push_back(session.SerializeAsString());
    return prepared(sessionURL.parent_path() / parsed->uploadFilenameString(), session.ByteSizeLong(), "FeedbackV2PB");
  }

  std::optional<UploadRequest> uploadJSONFeedback(const nlohmann::ordered_json& dictionary,
                                                  const fs::path& sessionURL) override {
    auto parsed = SessionFilename::fromString(sessionURL.filename().string());
    if (!parsed) return std::nullopt;
    log_->prepared.emplace_back(sessionURL, "FeedbackV2");
    return prepared(sessionURL.parent_path() / parsed->uploadFilenameString(), dictionary.dump().size(), "FeedbackV2");
  }

  std::optional<UploadRequest> uploadCustomFeedback(const fs::path& fileURL, const std::string& type) override {
    log_->prepared.emplace_back(fileURL, type);
    std::error_code ec;
    auto size = fs::file_size(fileURL, ec);
    return prepared(fs::path(fileURL.string() + ".uploadPending"), ec ? 0 : size, type);
  }

  void enqueue(UploadRequest request, UploadCompletion completion) override {
    log_->pending.push_back({std::move(request), std::move(completion)});
    if (log_->onEnqueue) log_->onEnqueue();
  }

  void retryUpload(const fs::path& fileURL, const std::string& typeString) override {
    log_->retried.emplace_back(fileURL, typeString);
  }

  size_t uploadsInFlight() const override { return log_->pending.size(); }
  void setDelegate(UploadManagerDelegate* delegate) override { delegate_ = delegate; }

  // Ends the oldest pending upload with `status` (0: no HTTP response), as
  // the real manager does: the count drops, then the completion and the
  // delegate hear of it. Must run on the work queue's thread.
  bool settleOldest(long status) {
    if (log_->pending.empty()) return false;
    Enqueued e = std::move(log_->pending.front());
    log_->pending.pop_front();
    ++log_->settled;
    if (status == 200) fs::remove(e.request.fileURL);
    std::optional<HttpResponse> response;
    std::optional<HttpError> error;
    if (status != 0) {
      response = HttpResponse{};
      response->statusCode = status;
    } else {
      error = HttpError{};
    }
    if (e.completion) e.completion(response, error);
    if (delegate_) delegate_->uploadManagerDidUploadFile(e.request.fileURL, status);
    return true;
  }

 private:
  std::optional<UploadRequest> prepared(fs::path uploadFile, uint64_t size, const std::string& type) {
    // The upload file exists, as the real manager's would.
    FILE* f = std::fopen(uploadFile.c_str(), "w");
    if (f) std::fclose(f);
    UploadRequest r;
    r.fileURL = std::move(uploadFile);
    r.uncompressedSize = static_cast<int64_t>(size);
    r.compressedSize = static_cast<int64_t>(size / 2);
    r.typeString = type;
    return r;
  }

  std::shared_ptr<Log> log_;
  UploadManagerDelegate* delegate_ = nullptr;
};

}  // namespace fbf::testing
