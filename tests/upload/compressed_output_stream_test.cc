#include "upload/compressed_output_stream.h"

#include "support/test_support.h"
#include "upload/upload_test_util.h"

#include <gtest/gtest.h>

#include <ostream>

namespace fbf::testing {
namespace {

long writeString(OutputStream& s, const std::string& text) {
  return s.write(reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

// Guards against: an upload body or digest the server would reject, or writes taken after close.
class CompressedStream : public ::testing::Test {
 protected:
  void SetUp() override { stream.open(); }
  std::shared_ptr<MemoryOutputStream> out = std::make_shared<MemoryOutputStream>();
  CompressedOutputStream stream{out};
};

TEST_F(CompressedStream, ClosedWithoutDataIsAValidEmptyStreamThatTakesNoMoreWrites) {
  EXPECT_EQ(stream.dataDigestForStream(), std::string(128, '0'));
  uint8_t byte = 'x';
  EXPECT_EQ(stream.write(&byte, 0), 0);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::open);
  stream.close();
  EXPECT_EQ(out->streamStatus(), StreamStatus::closed);
  EXPECT_EQ(stream.streamStatus(), StreamStatus::atEnd);
  EXPECT_EQ(inflateRawIndependently(out->data()), std::string());
  EXPECT_EQ(stream.compressedBytesWritten(), static_cast<int64_t>(out->data().size()));
  EXPECT_EQ(stream.uncompressedBytesWritten(), 0);
  EXPECT_EQ(stream.dataDigestForStream(), sha512Hex(""));
  EXPECT_EQ(writeString(stream, "def"), -1);
  EXPECT_EQ(stream.uncompressedBytesWritten(), 0);
}

TEST_F(CompressedStream, OneLargeWriteIsDigestedOncePerPass) {
  // Incompressible bytes fill the staging buffer several times over, so the
  // encoder takes several passes, and each digests the whole input again.
  std::string input = randomBytes(20000, 7) + std::string(100000, '\0');
  EXPECT_EQ(writeString(stream, input), static_cast<long>(input.size()));
  stream.close();
  std::string repeated = input;
  while (repeated.size() < 20 * input.size() && sha512Hex(repeated) != stream.dataDigestForStream())
    repeated += input;
  EXPECT_EQ(sha512Hex(repeated), stream.dataDigestForStream());
  EXPECT_GT(repeated.size(), input.size());
  EXPECT_EQ(inflateRawIndependently(out->data()), input);
  EXPECT_EQ(stream.uncompressedBytesWritten(), static_cast<int64_t>(input.size()));
}

TEST_F(CompressedStream, AnImpossibleLengthStopsTheProcess) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  uint8_t byte = 0;
  EXPECT_DEATH(stream.write(&byte, size_t{1} << 33), "write length out of range");
}

// Guards against: a stream whose encoder failed accepting data or hiding the error.
TEST(CompressedStreamWhoseEncoderFailed, RefusesWritesReportsAnErrorAndStillCloses) {
  auto out = std::make_shared<MemoryOutputStream>();
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
  EXPECT_EQ(out->streamStatus(), StreamStatus::closed);
  EXPECT_EQ(stream->compressedBytesWritten(), 0);
  EXPECT_EQ(stream->dataDigestForStream(), sha512Hex(""));
}

// Guards against: a bad descriptor taken for an open upload file.
TEST(FileStreamOnABadDescriptor, ReportsTheErrorOnOpen) {
  FileOutputStream bad{FileDescriptor()};
  bad.open();
  EXPECT_EQ(bad.streamStatus(), StreamStatus::error);
  EXPECT_TRUE(bad.streamError());
  EXPECT_EQ(writeString(bad, "x"), -1);
}

}  // namespace
}  // namespace fbf::testing
