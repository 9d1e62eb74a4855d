// Pieces the benchmarks share: payload text that compresses like uploaded
// sessions, and an output stream that only counts what it is given.
#pragma once

#include "upload/compressed_output_stream.h"

#include <cstddef>
#include <string>

namespace fbf::bench {

// Session-like text: repeated structure with varying identifiers,
// compressing about four to one as uploaded sessions do. Same seed, same text.
std::string sampleData(size_t n);

// Counts the bytes written to it and keeps nothing.
class NullStream final : public OutputStream {
 public:
  void open() override {}
  long write(const uint8_t*, size_t n) override {
    bytes += n;
    return static_cast<long>(n);
  }
  void close() override {}
  StreamStatus streamStatus() const override { return StreamStatus::open; }
  std::optional<std::error_code> streamError() const override { return std::nullopt; }
  size_t bytes = 0;
};

}  // namespace fbf::bench
