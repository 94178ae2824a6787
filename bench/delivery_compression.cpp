// Upload compression: CompressedOutputStream (raw DEFLATE in 4096-byte pieces plus the SHA-512
// digest, fed in 8192-byte writes as the upload manager does) against plain zlib deflate of the
// same bytes in one call. Inputs: a session-like JSON record and incompressible bytes (where a
// write fills the output buffer repeatedly and the digest hashes the input once per pass).
#include <benchmark/benchmark.h>
#include <zlib.h>

#include <random>
#include <string>

#include "delivery/output_stream.h"

namespace {

std::string sessionJson(std::size_t size) {
  std::string s = "{\"agent\":\"seekara/1\",\"fb\":[";
  for (int i = 0; s.size() < size; ++i) {
    s += "{\"type\":\"engagement\",\"query_id\":" + std::to_string(i * 7919 % 100003) +
         ",\"timestamp\":" + std::to_string(1700000000000LL + i * 37) + ",\"result\":{\"id\":\"r" +
         std::to_string(i % 113) + "\",\"section\":\"web\"}},";
  }
  s.resize(size);
  return s;
}

std::string noise(std::size_t size) {
  std::mt19937 random(7);
  std::string s(size, '\0');
  for (auto& c : s) c = static_cast<char>(random());
  return s;
}

const std::string& input(int kind, std::size_t size) {
  static std::string json, bytes;
  std::string& s = kind == 0 ? json : bytes;
  if (s.size() != size) s = kind == 0 ? sessionJson(size) : noise(size);
  return s;
}

void CompressedStream(benchmark::State& state) {
  const std::string& data = input(static_cast<int>(state.range(0)), static_cast<std::size_t>(state.range(1)));
  std::size_t out = 0;
  for (auto _ : state) {
    auto sink = std::make_shared<tavix::NullStream>();
    tavix::CompressedOutputStream stream(sink);
    stream.open();
    for (std::size_t offset = 0; offset < data.size(); offset += 8192) {
      stream.write(std::string_view(data).substr(offset, 8192));
    }
    stream.close();
    out = sink->bytesWritten();
    benchmark::DoNotOptimize(stream.digest());
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * state.range(1));
  state.counters["compressed_bytes"] = static_cast<double>(out);
}

void PlainDeflate(benchmark::State& state) {
  const std::string& data = input(static_cast<int>(state.range(0)), static_cast<std::size_t>(state.range(1)));
  std::string out(compressBound(data.size()) + 64, '\0');
  std::size_t produced = 0;
  for (auto _ : state) {
    z_stream zs{};
    deflateInit2(&zs, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY);
    zs.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(data.data()));
    zs.avail_in = static_cast<uInt>(data.size());
    zs.next_out = reinterpret_cast<Bytef*>(out.data());
    zs.avail_out = static_cast<uInt>(out.size());
    deflate(&zs, Z_FINISH);
    produced = zs.total_out;
    deflateEnd(&zs);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations()) * state.range(1));
  state.counters["compressed_bytes"] = static_cast<double>(produced);
}

// {kind (0 JSON, 1 noise), size}
void Args(benchmark::internal::Benchmark* b) {
  for (int kind : {0, 1}) {
    for (long size : {16L << 10, 256L << 10, 2L << 20}) b->Args({kind, size});
  }
}

BENCHMARK(CompressedStream)->Apply(Args);
BENCHMARK(PlainDeflate)->Apply(Args);

}  // namespace

BENCHMARK_MAIN();
