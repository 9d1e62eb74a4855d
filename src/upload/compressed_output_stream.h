// Write-only byte streams, and the compressing, digesting stream that upload
// payloads are written through.
//
// `OutputStream` is the small stream abstraction everything here writes to:
// open, write a byte range, close, a status and an error. `FileOutputStream`
// writes to an owned descriptor; `MemoryOutputStream` collects the bytes.
//
// `CompressedOutputStream` compresses everything written to it as a bare raw
// DEFLATE stream (zlib level 5, no header, no trailer) and passes the
// compressed bytes on to the stream it wraps, through one fixed 4096-byte
// staging buffer. While compressing it keeps a SHA-512 digest of the input,
// fed with a write's whole buffer once per compression pass of that write: a
// write that compresses in one pass contributes its bytes once, a write whose
// output fills the staging buffer before all of it is consumed contributes
// them once per pass. Writers that need the plain SHA-512 of their payload keep
// each write small (see `CompressedStreamBuf`). The server checks the digest
// as this procedure defines it.
//
// Thread-safety: none of these classes is thread-safe; one owner uses each
// from one thread (the upload manager, on the work queue).
#pragma once

#include "platform/file_manager.h"

#include <zlib.h>

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <streambuf>
#include <string>
#include <system_error>
#include <vector>

struct evp_md_ctx_st;

namespace fbf {

// The stream states, numbered as the platform's stream states are.
enum class StreamStatus { notOpen = 0, opening = 1, open = 2, reading = 3, writing = 4, atEnd = 5, closed = 6, error = 7 };

class OutputStream {
 public:
  virtual ~OutputStream() = default;
  virtual void open() = 0;
  // Writes up to `length` bytes; returns how many were taken, or -1 on error.
  virtual long write(const uint8_t* buffer, size_t length) = 0;
  virtual void close() = 0;
  virtual bool hasSpaceAvailable() const { return true; }
  virtual StreamStatus streamStatus() const = 0;
  // Set when `streamStatus()` is `error`.
  virtual std::optional<std::error_code> streamError() const = 0;
};

// Writes to a descriptor it owns, retrying short writes and EINTR. A failed
// write puts the stream in the error state with the errno as its error.
class FileOutputStream final : public OutputStream {
 public:
  explicit FileOutputStream(FileDescriptor fd) : fd_(std::move(fd)) {}
  void open() override;
  long write(const uint8_t* buffer, size_t length) override;
  void close() override;
  StreamStatus streamStatus() const override { return status_; }
  std::optional<std::error_code> streamError() const override { return error_; }

 private:
  FileDescriptor fd_;
  StreamStatus status_ = StreamStatus::notOpen;
  std::optional<std::error_code> error_;
};

// Collects everything written in memory.
class MemoryOutputStream final : public OutputStream {
 public:
  void open() override { status_ = StreamStatus::open; }
  long write(const uint8_t* buffer, size_t length) override;
  void close() override { status_ = StreamStatus::closed; }
  StreamStatus streamStatus() const override { return status_; }
  std::optional<std::error_code> streamError() const override { return std::nullopt; }
  const std::string& data() const { return data_; }

 private:
  std::string data_;
  StreamStatus status_ = StreamStatus::notOpen;
};

class CompressedOutputStream final : public OutputStream {
 public:
  static constexpr size_t kStagingBufferSize = 4096;
  static constexpr int kCompressionLevel = 5;
  // Compression status as the stream keeps it.
  static constexpr int32_t kStatusOK = 0;
  static constexpr int32_t kStatusEnd = 1;
  static constexpr int32_t kStatusError = -1;

  // Compresses into `outputStream`. An encoder that cannot be initialised
  // leaves the status at error, and every write then returns -1.
  explicit CompressedOutputStream(std::shared_ptr<OutputStream> outputStream);
  // Compresses into a new in-memory stream (see `wrapped()`).
  CompressedOutputStream();
  // A stream in the state a failed encoder initialisation leaves behind, so
  // that callers' error paths can be exercised.
  static std::unique_ptr<CompressedOutputStream> withUnavailableEncoder(std::shared_ptr<OutputStream> outputStream);
  ~CompressedOutputStream() override;
  CompressedOutputStream(const CompressedOutputStream&) = delete;
  CompressedOutputStream& operator=(const CompressedOutputStream&) = delete;

  // Opens the wrapped stream; nothing else.
  void open() override;
  // Compresses `length` bytes; returns the bytes consumed, or -1 when the
  // stream is already in a non-OK state. A length above 4294967295 stops the
  // process. Failures of the wrapped stream are not noticed.
  long write(const uint8_t* buffer, size_t length) override;
  // Finishes the DEFLATE stream, finalises the digest, releases the encoder
  // and closes the wrapped stream. Call exactly once, after the last write.
  void close() override;

  bool hasSpaceAvailable() const override { return true; }
  StreamStatus streamStatus() const override;
  // A POSIX-domain error with code 0 when the status is error.
  std::optional<std::error_code> streamError() const override;

  int64_t uncompressedBytesWritten() const { return uncompressedBytesWritten_; }
  int64_t compressedBytesWritten() const { return compressedBytesWritten_; }
  // The digest as 128 lower-case hex digits; all zeros before `close`.
  std::string dataDigestForStream() const;
  int32_t status() const { return status_; }
  const std::shared_ptr<OutputStream>& wrapped() const { return outputStream_; }

 private:
  CompressedOutputStream(std::shared_ptr<OutputStream> outputStream, int windowBits);
  void updateDigest(const uint8_t* buffer, size_t length);

  std::shared_ptr<OutputStream> outputStream_;
  z_stream stream_{};
  bool encoderLive_ = false;
  int32_t status_ = kStatusOK;
  std::array<uint8_t, kStagingBufferSize> destBuffer_{};
  evp_md_ctx_st* shaContext_ = nullptr;
  std::array<uint8_t, 64> digest_{};
  int64_t uncompressedBytesWritten_ = 0;
  int64_t compressedBytesWritten_ = 0;
};

// A std::streambuf over an OutputStream, so that anything that writes to a
// std::ostream (the JSON serialiser) streams straight into it. It hands the
// stream at most `kChunkSize` bytes per write: full chunks as the buffer
// fills, the rest on `pubsync()` (or when the std::ostream is flushed). Small
// writes are what keeps a payload's digest the plain SHA-512 of its bytes.
// A failed write of the stream makes the std::ostream go bad.
class CompressedStreamBuf final : public std::streambuf {
 public:
  static constexpr size_t kChunkSize = 1024;
  explicit CompressedStreamBuf(OutputStream& out);
  ~CompressedStreamBuf() override;

 protected:
  int_type overflow(int_type ch) override;
  int sync() override;

 private:
  bool flushBuffer();
  OutputStream& out_;
  std::array<char, kChunkSize> buffer_{};
};

}  // namespace fbf
