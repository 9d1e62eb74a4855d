// Helpers shared by the upload tests: an inflater and a digest that do not go
// through the code under test, and incompressible bytes.
#pragma once

#include <openssl/evp.h>
#include <fmt/ranges.h>
#include <zlib.h>

#include <optional>
#include <random>
#include <string>

namespace fbf::testing {

// Raw DEFLATE; no value unless `compressed` is exactly one complete stream.
inline std::optional<std::string> inflateRawIndependently(const std::string& compressed) {
  z_stream z{};
  if (inflateInit2(&z, -15) != Z_OK) return std::nullopt;
  std::string out;
  char buf[16384];
  z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  z.avail_in = static_cast<uInt>(compressed.size());
  int rc;
  do {
    z.next_out = reinterpret_cast<Bytef*>(buf);
    z.avail_out = sizeof buf;
    rc = inflate(&z, Z_NO_FLUSH);
    out.append(buf, sizeof buf - z.avail_out);
  } while (rc == Z_OK);
  bool ok = rc == Z_STREAM_END && z.avail_in == 0;
  inflateEnd(&z);
  if (!ok) return std::nullopt;
  return out;
}

inline std::string sha512Hex(const std::string& data) {
  unsigned char md[64];
  unsigned int len = 0;
  EVP_Digest(data.data(), data.size(), md, &len, EVP_sha512(), nullptr);
  return fmt::format("{:02x}", fmt::join(md, md + len, ""));
}

inline std::string randomBytes(size_t n, uint32_t seed) {
  std::mt19937 rng(seed);
  std::string out(n, '\0');
  for (auto& c : out) c = static_cast<char>(rng() & 0xff);
  return out;
}

}  // namespace fbf::testing
