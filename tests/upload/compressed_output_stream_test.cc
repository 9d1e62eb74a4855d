#include "upload/compressed_output_stream.h"

#include "support/test_support.h"
#include "upload/upload_test_util.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <ostream>

namespace fbf {
namespace {

using testing::inflateRawIndependently;
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
  void close() override { status_ = StreamStatus::closed; }
  StreamStatus streamStatus() const override { return status_; }
  std::optional<std::error_code> streamError() const override { return std::nullopt; }

  std::vector<size_t> writes;
  std::string data;
  StreamStatus status_ = StreamStatus::notOpen;
};

long writeString(OutputStream& s, const std::string& text) {
  return s.write(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

// Guards against: an upload body that does not inflate to the payload, a digest
// or byte count the server would reject, or writes accepted once the stream is
// closed or its encoder failed.
class CompressedStream : public ::testing::Test {
 protected:
  void SetUp() override { stream.open(); }
  std::shared_ptr<RecordingOutputStream> out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream{out};
};

TEST_F(CompressedStream, ClosedWithoutDataIsAValidEmptyStreamWithTheEmptyDigest) {
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  EXPECT_FALSE(stream.streamError());
  EXPECT_EQ(stream.dataDigestForStream(), std::string(128, '0'));
  EXPECT_TRUE(stream.hasSpaceAvailable());
  uint8_t byte = 'x';
  EXPECT_EQ(stream.write(&byte, 0), 0);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  stream.close();
  EXPECT_EQ(out->status_, StreamStatus::closed);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::atEnd);
  EXPECT_EQ(inflateRawIndependently(out->data), std::string());
  EXPECT_GT(out->data.size(), 0u);
  EXPECT_EQ(stream.compressedBytesWritten(), static_cast<int64_t>(out->data.size()));
  EXPECT_EQ(stream.uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(""));
}

TEST_F(CompressedStream, SmallWritesInflateToTheInputAndAreDigestedOnce) {
  std::string all;
  for (int i = 0; i < 60; ++i) {
    std::string piece;
    for (int j = 0; j < 20 + i; ++j)
      piece += "{\"queryId\":" + std::to_string(j % 9) + ",\"rank\":3},";
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
  EXPECT_EQ(writeString(stream, "def"), -1);
  EXPECT_EQ(stream.uncompressedBytesWritten(), static_cast<int64_t>(all.size()));
}

TEST_F(CompressedStream, OneLargeWriteIsDigestedOncePerPass) {
  // Incompressible bytes fill the staging buffer several times over; the run
  // of zeros behind them compresses to almost nothing, so the last pass (the
  // one that uses the input up) cannot fill the buffer. Every other pass ends
  // because the buffer is full and hands on exactly 4096 bytes.
  std::string input = testing::randomBytes(20000, 7) + std::string(100000, '\0');
  EXPECT_EQ(writeString(stream, input), static_cast<long>(input.size()));
  ASSERT_FALSE(out->writes.empty());
  ASSERT_LT(out->writes.back(), CompressedOutputStream::kStagingBufferSize);
  size_t passes = 1 + std::count(out->writes.begin(), out->writes.end(),
                                 CompressedOutputStream::kStagingBufferSize);
  ASSERT_GE(passes, 2u);
  stream.close();
  std::string repeated;
  for (size_t i = 0; i < passes; ++i) repeated += input;
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(repeated));
  EXPECT_EQ(inflateRawIndependently(out->data), input);
  EXPECT_EQ(stream.uncompressedBytesWritten(), static_cast<int64_t>(input.size()));
}

TEST_F(CompressedStream, AnImpossibleLengthStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  uint8_t byte = 0;
  EXPECT_DEATH(stream.write(&byte, size_t{1} << 33), "write length out of range");
}

TEST(CompressedStreamWhoseEncoderFailed, RefusesWritesReportsAnErrorAndStillCloses) {
  auto out = std::make_shared<RecordingOutputStream>();
  auto stream = CompressedOutputStream::withUnavailableEncoder(out);
  stream->open();
  EXPECT_EQ(writeString(*stream, "payload"), -1);
  EXPECT_EQ(stream->uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream->streamStatus(), StreamStatus::error);
  ASSERT_TRUE(stream->streamError());
  EXPECT_EQ(stream->streamError()->value(), 0);
  {
    CompressedStreamBuf buffer(*stream);
    std::ostream os(&buffer);
    os << std::string(3000, 'a') << std::flush;
    EXPECT_TRUE(os.bad());
  }
  stream->close();
  EXPECT_EQ(out->status_, StreamStatus::closed);
  EXPECT_EQ(stream->compressedBytesWritten(), 0);
  EXPECT_EQ(stream->dataDigestForStream(), sha512Hex(""));
}

// Guards against: compressed bytes lost on their way to the upload file, or a
// bad descriptor taken for an open file.
TEST(CompressedStreamIntoAFile, WritesTheCompressedBytesThere) {
  testing::TempDir dir;
  auto path = dir.path() / "out.deflate";
  FileDescriptor fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  auto file = std::make_shared<FileOutputStream>(std::move(fd));
  CompressedOutputStream stream(file);
  stream.open();
  EXPECT_EQ(file->streamStatus(), StreamStatus::open);
  std::string input = testing::randomBytes(3000, 1) + std::string(30000, 'q');
  for (size_t off = 0; off < input.size(); off += 8192)
    writeString(stream, input.substr(off, 8192));
  stream.close();
  EXPECT_EQ(file->streamStatus(), StreamStatus::closed);
  auto bytes = testing::readFile(path);
  EXPECT_EQ(static_cast<int64_t>(bytes.size()), stream.compressedBytesWritten());
  EXPECT_EQ(inflateRawIndependently(bytes), input);

  FileOutputStream bad{FileDescriptor()};
  bad.open();
  EXPECT_EQ(bad.streamStatus(), StreamStatus::error);
  EXPECT_TRUE(bad.streamError());
  EXPECT_EQ(writeString(bad, "x"), -1);
}

// Guards against: JSON streamed in chunks larger than the buffer, or bytes lost
// or digested twice on the way from the serialiser to the compressor.
TEST(JSONStreamedThroughTheStreamBuffer, ArrivesInSmallWritesWithThePlainDigest) {
  nlohmann::ordered_json session = {{"user_guid", "8E3B4C1A"},
                                    {"feedbacks", nlohmann::json::array()}};
  for (int i = 0; i < 500; ++i) session["feedbacks"].push_back({{"queryId", i}, {"rank", i % 7}});
  std::string expected = session.dump();

  RecordingOutputStream chunks;
  auto out = std::make_shared<RecordingOutputStream>();
  CompressedOutputStream stream(out);
  stream.open();
  for (OutputStream* target :
       {static_cast<OutputStream*>(&chunks), static_cast<OutputStream*>(&stream)}) {
    CompressedStreamBuf buffer(*target);
    std::ostream os(&buffer);
    os << session << std::flush;
    EXPECT_TRUE(os.good());
  }
  stream.close();
  EXPECT_EQ(chunks.data, expected);
  ASSERT_GT(chunks.writes.size(), 10u);
  for (size_t w : chunks.writes) EXPECT_LE(w, CompressedStreamBuf::kChunkSize);
  EXPECT_EQ(inflateRawIndependently(out->data), expected);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(expected));
}

}  // namespace
}  // namespace fbf
