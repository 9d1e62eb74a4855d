#include "upload/compressed_output_stream.h"

#include "support/test_support.h"
#include "upload/upload_test_util.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <fcntl.h>

#include <ostream>

namespace fbf {
namespace {

using testing::compressibleText;
using testing::inflateRawIndependently;
using testing::randomBytes;
using testing::sha512Hex;

// Records every write it is handed, so a test can see the stream's passes.
class RecordingOutputStream final : public OutputStream {
 public:
  void open() override { status_ = StreamStatus::open; }
  long write(const uint8_t* buffer, size_t length) override {
    writes.push_back(length);
    data.append(reinterpret_cast<const char*>(buffer), length);
    return static_cast<long>(length);
  }
  void close() override {
    closed = true;
    status_ = StreamStatus::closed;
  }
  StreamStatus streamStatus() const override { return status_; }
  std::optional<std::error_code> streamError() const override { return std::nullopt; }

  std::vector<size_t> writes;
  std::string data;
  bool closed = false;

 private:
  StreamStatus status_ = StreamStatus::notOpen;
};

long writeString(OutputStream& s, const std::string& text) {
  return s.write(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

TEST(CompressedStreamFreshlyMade, IsOpenWithAZeroDigestAndNoCounts) {
  CompressedOutputStream stream;
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  EXPECT_FALSE(stream.streamError());
  EXPECT_EQ(stream.dataDigestForStream(), std::string(128, '0'));
  EXPECT_EQ(stream.uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream.compressedBytesWritten(), 0);
  EXPECT_TRUE(stream.hasSpaceAvailable());
}

TEST(CompressedStreamClosedWithoutWrites, IsAValidEmptyDeflateStreamWithTheEmptyDigest) {
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  stream.close();
  EXPECT_TRUE(out->closed);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::atEnd);
  EXPECT_EQ(inflateRawIndependently(out->data), std::string());
  EXPECT_GT(out->data.size(), 0u);
  EXPECT_EQ(stream.compressedBytesWritten(), static_cast<int64_t>(out->data.size()));
  EXPECT_EQ(stream.uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(""));
}

TEST(CompressedStreamWithSmallWrites, InflatesToTheInputAndDigestsItOnce) {
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  std::string all;
  for (int i = 0; i < 200; ++i) {
    std::string piece = compressibleText(700 + i);
    all += piece;
    EXPECT_EQ(writeString(stream, piece), static_cast<long>(piece.size()));
  }
  stream.close();
  EXPECT_EQ(inflateRawIndependently(out->data), all);
  EXPECT_EQ(stream.uncompressedBytesWritten(), static_cast<int64_t>(all.size()));
  EXPECT_EQ(stream.compressedBytesWritten(), static_cast<int64_t>(out->data.size()));
  EXPECT_LT(stream.compressedBytesWritten(), stream.uncompressedBytesWritten() / 4);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(all));
  for (size_t w : out->writes) EXPECT_LE(w, CompressedOutputStream::kStagingBufferSize);
}

TEST(CompressedStreamWithOneLargeWrite, DigestsTheInputOncePerPass) {
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  // Incompressible bytes fill the staging buffer many times over; the long
  // run of zeros behind them compresses to almost nothing, so the last pass
  // (the one that uses the input up) cannot fill the buffer. Every other pass
  // ends because the buffer is full and hands on exactly 4096 bytes.
  std::string input = randomBytes(100000, 7) + std::string(1000000, '\0');
  EXPECT_EQ(writeString(stream, input), static_cast<long>(input.size()));
  ASSERT_FALSE(out->writes.empty());
  ASSERT_LT(out->writes.back(), CompressedOutputStream::kStagingBufferSize);
  size_t fullPasses = 0;
  for (size_t w : out->writes) fullPasses += w == CompressedOutputStream::kStagingBufferSize ? 1 : 0;
  size_t passes = fullPasses + 1;
  ASSERT_GE(passes, 2u);
  stream.close();

  std::string repeated;
  for (size_t i = 0; i < passes; ++i) repeated += input;
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(repeated));
  EXPECT_NE(stream.dataDigestForStream(), sha512Hex(input));
  EXPECT_EQ(inflateRawIndependently(out->data), input);
  EXPECT_EQ(stream.uncompressedBytesWritten(), static_cast<int64_t>(input.size()));
}

TEST(CompressedStreamWithAnEmptyWrite, ReturnsZeroAndChangesNothing) {
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  uint8_t byte = 'x';
  EXPECT_EQ(stream.write(&byte, 0), 0);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  EXPECT_EQ(writeString(stream, "abc"), 3);
  stream.close();
  EXPECT_EQ(stream.uncompressedBytesWritten(), 3);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex("abc"));
  EXPECT_EQ(inflateRawIndependently(out->data), "abc");
}

TEST(CompressedStreamWhoseEncoderFailed, RefusesWritesAndReportsAnError) {
  auto out = std::make_shared<RecordingOutputStream>();
  auto stream = CompressedOutputStream::withUnavailableEncoder(out);
  stream->open();
  EXPECT_EQ(writeString(*stream, "payload"), -1);
  EXPECT_EQ(writeString(*stream, "more"), -1);
  EXPECT_EQ(stream->uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream->compressedBytesWritten(), 0);
  EXPECT_EQ(stream->streamStatus(), StreamStatus::error);
  ASSERT_TRUE(stream->streamError());
  EXPECT_EQ(stream->streamError()->value(), 0);
  EXPECT_EQ(stream->streamError()->category(), std::generic_category());
  // Closing still finishes: the digest of nothing, the wrapped stream closed.
  stream->close();
  EXPECT_TRUE(out->closed);
  EXPECT_EQ(stream->dataDigestForStream(), sha512Hex(""));
}

TEST(CompressedStreamAfterClose, RefusesWrites) {
  CompressedOutputStream stream;
  stream.open();
  writeString(stream, "abc");
  stream.close();
  EXPECT_EQ(writeString(stream, "def"), -1);
  EXPECT_EQ(stream.uncompressedBytesWritten(), 3);
}

TEST(CompressedStreamGivenAnImpossibleLength, StopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      {
        CompressedOutputStream stream;
        stream.open();
        uint8_t byte = 0;
        stream.write(&byte, size_t{1} << 33);
      },
      "write length out of range");
}

TEST(CompressedStreamIntoAFile, WritesTheCompressedBytesThere) {
  testing::TempDir dir;
  auto path = dir.path() / "out.deflate";
  FileDescriptor fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  ASSERT_TRUE(fd.valid());
  auto file = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(file);
  stream.open();
  EXPECT_EQ(file->streamStatus(), StreamStatus::open);
  std::string input = compressibleText(50000);
  for (size_t off = 0; off < input.size(); off += 8192) writeString(stream, input.substr(off, 8192));
  stream.close();
  EXPECT_EQ(file->streamStatus(), StreamStatus::closed);
  auto bytes = testing::readFile(path);
  EXPECT_EQ(static_cast<int64_t>(bytes.size()), stream.compressedBytesWritten());
  EXPECT_EQ(inflateRawIndependently(bytes), input);
}

TEST(FileStreamOnABadDescriptor, ReportsTheErrorOnOpen) {
  FileOutputStream file{FileDescriptor()};
  file.open();
  EXPECT_EQ(file.streamStatus(), StreamStatus::error);
  EXPECT_TRUE(file.streamError());
  uint8_t byte = 0;
  EXPECT_EQ(file.write(&byte, 1), -1);
}

TEST(JSONStreamedThroughTheStreamBuffer, ArrivesInSmallWritesWithThePlainDigest) {
  nlohmann::ordered_json session;
  session["user_guid"] = "8E3B4C1A";
  session["feedbacks"] = nlohmann::ordered_json::array();
  for (int i = 0; i < 2000; ++i) session["feedbacks"].push_back({{"queryId", i}, {"type", "engagement"}, {"rank", i % 7}});
  std::string expected = session.dump();

  RecordingOutputStream sizes;
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  // Watch the writes the stream receives by putting the recorder between.
  class Tee final : public OutputStream {
   public:
    Tee(OutputStream& a, RecordingOutputStream& b) : a_(a), b_(b) {}
    void open() override {}
    long write(const uint8_t* p, size_t n) override {
      b_.writes.push_back(n);
      return a_.write(p, n);
    }
    void close() override {}
    StreamStatus streamStatus() const override { return a_.streamStatus(); }
    std::optional<std::error_code> streamError() const override { return a_.streamError(); }

   private:
    OutputStream& a_;
    RecordingOutputStream& b_;
  } tee(stream, sizes);
  {
    CompressedStreamBuf buffer(tee);
    std::ostream os(&buffer);
    os << session;
    os.flush();
    EXPECT_TRUE(os.good());
  }
  stream.close();
  ASSERT_GT(sizes.writes.size(), 10u);
  for (size_t w : sizes.writes) EXPECT_LE(w, CompressedStreamBuf::kChunkSize);
  EXPECT_EQ(inflateRawIndependently(out->data), expected);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(expected));
}

TEST(StreamBufferOverAFailedStream, MakesTheOStreamGoBad) {
  auto stream = CompressedOutputStream::withUnavailableEncoder(std::make_shared<MemoryOutputStream>());
  stream->open();
  CompressedStreamBuf buffer(*stream);
  std::ostream os(&buffer);
  os << std::string(3000, 'a');
  os.flush();
  EXPECT_TRUE(os.bad());
}

}  // namespace
}  // namespace fbf
