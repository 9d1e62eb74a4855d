#include "support/bench_support.h"

#include <random>

namespace fbf::bench {

std::string sampleData(size_t n) {
  std::mt19937 rng(42);
  std::string out;
  out.reserve(n + 256);
  while (out.size() < n) {
    out += "{\"queryId\":" + std::to_string(rng() % 100000) + ",\"type\":" + std::to_string(rng() % 40) +
           ",\"identifier\":\"" + std::to_string(rng()) + "-" + std::to_string(rng()) +
           "\",\"rank\":" + std::to_string(rng() % 10) + ",\"section\":\"web\"},";
  }
  out.resize(n);
  return out;
}

}  // namespace fbf::bench
