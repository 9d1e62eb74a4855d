#include "upload/compressed_output_stream.h"

#include "util/lock.h"

#include <openssl/evp.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <limits>

namespace fbf {

// ---- FileOutputStream ----

void FileOutputStream::open() {
  if (status_ != StreamStatus::notOpen) return;
  if (!fd_.valid()) {
    status_ = StreamStatus::error;
    error_ = std::make_error_code(std::errc::bad_file_descriptor);
    return;
  }
  status_ = StreamStatus::open;
}

long FileOutputStream::write(const uint8_t* buffer, size_t length) {
  if (status_ != StreamStatus::open) return -1;
  size_t done = 0;
  while (done < length) {
    ssize_t n = ::write(fd_.get(), buffer + done, length - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      error_ = std::error_code(errno, std::generic_category());
      status_ = StreamStatus::error;
      return -1;
    }
    done += static_cast<size_t>(n);
  }
  return static_cast<long>(done);
}

void FileOutputStream::close() {
  if (fd_.valid() && ::close(fd_.release()) != 0 && status_ != StreamStatus::error) {
    error_ = std::error_code(errno, std::generic_category());
    status_ = StreamStatus::error;
    return;
  }
  if (status_ != StreamStatus::error) status_ = StreamStatus::closed;
}

// ---- MemoryOutputStream ----

long MemoryOutputStream::write(const uint8_t* buffer, size_t length) {
  if (status_ != StreamStatus::open) return -1;
  data_.append(reinterpret_cast<const char*>(buffer), length);
  return static_cast<long>(length);
}

// ---- CompressedOutputStream ----

namespace {

// The one place zlib's return codes become the stream's status. "No progress
// possible" is not an error: it is what an empty write or an already drained
// encoder reports.
int32_t statusFromZlib(int z) {
  switch (z) {
    case Z_OK:
    case Z_BUF_ERROR:
      return CompressedOutputStream::kStatusOK;
    case Z_STREAM_END:
      return CompressedOutputStream::kStatusEnd;
    default:
      return CompressedOutputStream::kStatusError;
  }
}

int64_t checkedAdd(int64_t a, int64_t b) {
  int64_t out;
  if (__builtin_add_overflow(a, b, &out)) FBF_FATAL("byte counter overflow");
  return out;
}

}  // namespace

CompressedOutputStream::CompressedOutputStream(std::shared_ptr<OutputStream> outputStream)
    : CompressedOutputStream(std::move(outputStream), -15) {}

CompressedOutputStream::CompressedOutputStream(std::shared_ptr<OutputStream> outputStream, int windowBits)
    : outputStream_(std::move(outputStream)) {
  if (!outputStream_) FBF_FATAL("CompressedOutputStream needs a stream to write to");
  stream_.next_out = destBuffer_.data();
  stream_.avail_out = 0;
  stream_.next_in = nullptr;
  stream_.avail_in = 0;
  int z = deflateInit2(&stream_, kCompressionLevel, Z_DEFLATED, windowBits, 8, Z_DEFAULT_STRATEGY);
  status_ = statusFromZlib(z);
  encoderLive_ = z == Z_OK;
  shaContext_ = EVP_MD_CTX_new();
  if (!shaContext_ || EVP_DigestInit_ex(shaContext_, EVP_sha512(), nullptr) != 1) {
    FBF_FATAL("SHA-512 could not be initialised");
  }
}

CompressedOutputStream::CompressedOutputStream() : CompressedOutputStream(std::make_shared<MemoryOutputStream>()) {}

std::unique_ptr<CompressedOutputStream> CompressedOutputStream::withUnavailableEncoder(
    std::shared_ptr<OutputStream> outputStream) {
  // Window bits outside every valid range make deflateInit2 refuse.
  return std::unique_ptr<CompressedOutputStream>(new CompressedOutputStream(std::move(outputStream), 99));
}

CompressedOutputStream::~CompressedOutputStream() {
  if (encoderLive_) deflateEnd(&stream_);
  EVP_MD_CTX_free(shaContext_);
}

void CompressedOutputStream::open() { outputStream_->open(); }

void CompressedOutputStream::updateDigest(const uint8_t* buffer, size_t length) {
  if (EVP_DigestUpdate(shaContext_, buffer, length) != 1) FBF_FATAL("SHA-512 update failed");
}

long CompressedOutputStream::write(const uint8_t* buffer, size_t length) {
  if (status_ != kStatusOK) return -1;
  stream_.next_in = const_cast<Bytef*>(buffer);
  stream_.next_out = destBuffer_.data();
  stream_.avail_out = kStagingBufferSize;
  if (length > std::numeric_limits<uint32_t>::max()) FBF_FATAL("write length out of range");
  stream_.avail_in = static_cast<uInt>(length);

  do {
    // The whole buffer goes into the digest on every pass, by definition of
    // the digest the server checks.
    updateDigest(buffer, length);
    status_ = statusFromZlib(deflate(&stream_, Z_NO_FLUSH));
    if (status_ != kStatusOK) break;
    if (stream_.avail_out != kStagingBufferSize) {
      size_t produced = kStagingBufferSize - stream_.avail_out;
      if (produced >= 1) compressedBytesWritten_ = checkedAdd(compressedBytesWritten_, static_cast<int64_t>(produced));
      outputStream_->write(destBuffer_.data(), produced);
      stream_.next_out = destBuffer_.data();
      stream_.avail_out = kStagingBufferSize;
      if (status_ != kStatusOK) break;
    }
  } while (stream_.avail_in != 0);

  int64_t consumed = static_cast<int64_t>(length) - static_cast<int64_t>(stream_.avail_in);
  if (consumed >= 1) uncompressedBytesWritten_ = checkedAdd(uncompressedBytesWritten_, consumed);
  return static_cast<long>(consumed);
}

void CompressedOutputStream::close() {
  while (true) {
    stream_.avail_in = 0;
    stream_.next_out = destBuffer_.data();
    stream_.avail_out = kStagingBufferSize;
    status_ = encoderLive_ ? statusFromZlib(deflate(&stream_, Z_FINISH)) : kStatusError;
    size_t produced = static_cast<size_t>(stream_.next_out - destBuffer_.data());
    if (produced >= 1) compressedBytesWritten_ = checkedAdd(compressedBytesWritten_, static_cast<int64_t>(produced));
    outputStream_->write(destBuffer_.data(), produced);
    if (status_ != kStatusOK) break;
  }
  unsigned int size = 0;
  if (EVP_DigestFinal_ex(shaContext_, digest_.data(), &size) != 1 || size != digest_.size()) {
    FBF_FATAL("SHA-512 finalisation failed");
  }
  if (encoderLive_) {
    deflateEnd(&stream_);
    encoderLive_ = false;
  }
  outputStream_->close();
}

StreamStatus CompressedOutputStream::streamStatus() const {
  switch (status_) {
    case kStatusError:
      return StreamStatus::error;
    case kStatusOK:
      return StreamStatus::open;
    case kStatusEnd:
      return StreamStatus::atEnd;
    default:
      return StreamStatus::notOpen;
  }
}

std::optional<std::error_code> CompressedOutputStream::streamError() const {
  if (status_ != kStatusError) return std::nullopt;
  return std::error_code(0, std::generic_category());
}

std::string CompressedOutputStream::dataDigestForStream() const {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(digest_.size() * 2);
  for (uint8_t b : digest_) {
    out.push_back(kHex[b >> 4]);
    out.push_back(kHex[b & 0xf]);
  }
  return out;
}

// ---- CompressedStreamBuf ----

CompressedStreamBuf::CompressedStreamBuf(OutputStream& out) : out_(out) {
  setp(buffer_.data(), buffer_.data() + buffer_.size());
}

CompressedStreamBuf::~CompressedStreamBuf() { flushBuffer(); }

bool CompressedStreamBuf::flushBuffer() {
  auto n = static_cast<size_t>(pptr() - pbase());
  if (n == 0) return true;
  long written = out_.write(reinterpret_cast<const uint8_t*>(pbase()), n);
  setp(buffer_.data(), buffer_.data() + buffer_.size());
  return written == static_cast<long>(n);
}

CompressedStreamBuf::int_type CompressedStreamBuf::overflow(int_type ch) {
  if (!flushBuffer()) return traits_type::eof();
  if (traits_type::eq_int_type(ch, traits_type::eof())) return traits_type::not_eof(ch);
  *pptr() = traits_type::to_char_type(ch);
  pbump(1);
  return ch;
}

int CompressedStreamBuf::sync() { return flushBuffer() ? 0 : -1; }

}  // namespace fbf
