// Where the compressing stream's time goes for one-write payloads of 20 to
// 200 KB (the size of uploaded sessions; such a write takes several
// compression passes, and the digest hashes the whole write once per pass):
// the stream as it is, the same DEFLATE passes without the digest, and the
// digest alone (the payload hashed once per pass). Moving the digest to a
// second thread while DEFLATE runs could at best hide the smaller of the
// two, which is what decides whether that is worth a thread hand-over per
// pass. Google Benchmark, thread CPU time.
#include "upload/compressed_output_stream.h"
#include "support/bench_support.h"

#include <benchmark/benchmark.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>

namespace {

using fbf::bench::NullStream;
using fbf::bench::sampleData;

size_t streamEncode(const std::string& data) {
  auto sink = std::make_shared<NullStream>();
  fbf::CompressedOutputStream stream(sink);
  stream.open();
  stream.write(reinterpret_cast<const uint8_t*>(data.data()), data.size());
  stream.close();
  return sink->bytes;
}

// The stream's DEFLATE passes (one write, 4096-byte staging buffer), no digest.
size_t deflateOnly(const std::string& data, size_t* passes) {
  z_stream z{};
  deflateInit2(&z, fbf::CompressedOutputStream::kCompressionLevel, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY);
  unsigned char out[fbf::CompressedOutputStream::kStagingBufferSize];
  size_t total = 0;
  *passes = 0;
  z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(data.data()));
  z.avail_in = static_cast<uInt>(data.size());
  do {
    ++*passes;
    z.next_out = out;
    z.avail_out = sizeof out;
    deflate(&z, Z_NO_FLUSH);
    total += sizeof out - z.avail_out;
  } while (z.avail_in != 0);
  int rc;
  do {
    z.next_out = out;
    z.avail_out = sizeof out;
    rc = deflate(&z, Z_FINISH);
    total += sizeof out - z.avail_out;
  } while (rc == Z_OK);
  deflateEnd(&z);
  return total;
}

// The stream's digest alone: the payload hashed once per pass.
void digestOnly(const std::string& data, size_t passes) {
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  EVP_DigestInit_ex(ctx, EVP_sha512(), nullptr);
  for (size_t i = 0; i < passes; ++i) EVP_DigestUpdate(ctx, data.data(), data.size());
  unsigned char md[64];
  unsigned int len = 0;
  EVP_DigestFinal_ex(ctx, md, &len);
  EVP_MD_CTX_free(ctx);
  benchmark::DoNotOptimize(md);
}

enum Part { kStream = 0, kDeflate = 1, kDigest = 2 };

void BM_OneWrite(benchmark::State& state) {
  const std::string data = sampleData(static_cast<size_t>(state.range(0)) * 1024);
  const auto part = static_cast<Part>(state.range(1));
  size_t passes = 0;
  deflateOnly(data, &passes);
  for (auto _ : state) {
    switch (part) {
      case kStream: benchmark::DoNotOptimize(streamEncode(data)); break;
      case kDeflate: benchmark::DoNotOptimize(deflateOnly(data, &passes)); break;
      case kDigest: digestOnly(data, passes); break;
    }
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations()) * static_cast<int64_t>(data.size()));
  state.counters["passes"] = static_cast<double>(passes);
  state.SetLabel(part == kStream ? "stream" : part == kDeflate ? "deflate passes only" : "digest only");
}

BENCHMARK(BM_OneWrite)
    ->ArgNames({"KB", "part"})
    ->ArgsProduct({{20, 50, 100, 200}, {kStream, kDeflate, kDigest}})
    ->Unit(benchmark::kMicrosecond);

}  // namespace

BENCHMARK_MAIN();
