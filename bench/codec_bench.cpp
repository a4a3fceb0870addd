// Micro-benchmarks of the codecs on the hot paths: MessagePack for every IPC message
// (a typical event carries four parameters and a payload of ten keys) and compact JSON
// for the upload batches (fifty event records of about 400 bytes each).
//
// Build in Release without sanitizers; numbers from Debug or sanitized builds mean
// nothing.
#include <benchmark/benchmark.h>
#include <msgpack.h>

#include <string>
#include <vector>

#include "platform/Json.h"
#include "platform/Log.h"
#include "platform/MessagePack.h"
#include "util/Compression.h"
#include "telvane/Value.h"

namespace {

using namespace telvane;

Value typicalEvent() {
  Dictionary payload{
      {"bytesReceived", 1843200},
      {"bytesSent", 20480},
      {"durationMs", 1375},
      {"interface", "wlan0"},
      {"latencyMs", 23.5},
      {"result", "success"},
      {"retries", 2},
      {"rssi", -61},
      {"serverHost", "collector.example.invalid"},
      {"sessionID", "6f1c2a4e-8b3d-4e5f-9a7b-0c1d2e3f4a5b"},
  };
  return Value(Dictionary{{"ParametersCategory", 101},
                          {"ParametersType", 7},
                          {"ParametersFlag", 0},
                          {"ParametersPayload", Value(std::move(payload))}});
}

// An upload record: the four bookkeeping keys and a payload, about 400 bytes of JSON.
Value eventRecord(int i) {
  Dictionary record{
      {"_category", "com.zembra.telvane.networkQuality"},
      {"_type", "transferCompleted"},
      {"_timestamp", 1700000000123LL + i * 977},
      {"_clientName", "com.zembra.example.downloader"},
      {"bytesReceived", 1843200 + i},
      {"bytesSent", 20480 + 3 * i},
      {"durationMs", 1375 + i % 17},
      {"interface", "wlan0"},
      {"latencyMs", 23.5 + i * 0.125},
      {"result", "success"},
      {"retries", i % 3},
      {"rssi", -61 - i % 9},
      {"serverHost", "collector-eu-west-2.example.invalid"},
      {"sessionID", "6f1c2a4e-8b3d-4e5f-9a7b-0c1d2e3f4a5b"},
      {"throughputMbps", 87.25 - i * 0.5},
  };
  return Value(std::move(record));
}

constexpr int kRecordsPerBatch = 50;

void BM_MessagePackEncodeEvent(benchmark::State& state) {
  const Value event = typicalEvent();
  std::string out;
  for (auto _ : state) {
    out.clear();
    msgpack_codec::encode(event, out);
    benchmark::DoNotOptimize(out.data());
  }
  state.SetItemsProcessed(state.iterations());
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(out.size()));
  state.counters["message_bytes"] = static_cast<double>(out.size());
}
BENCHMARK(BM_MessagePackEncodeEvent);

void BM_MessagePackDecodeEvent(benchmark::State& state) {
  std::string bytes;
  msgpack_codec::encode(typicalEvent(), bytes);
  for (auto _ : state) {
    auto decoded = msgpack_codec::decode(bytes);
    benchmark::DoNotOptimize(decoded);
  }
  state.SetItemsProcessed(state.iterations());
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(bytes.size()));
}
BENCHMARK(BM_MessagePackDecodeEvent);

// For comparison: msgpack-c's own unpacker, which only builds its object tree in a
// zone (no Value at the end).
void BM_MsgpackCUnpackEventOnly(benchmark::State& state) {
  std::string bytes;
  msgpack_codec::encode(typicalEvent(), bytes);
  for (auto _ : state) {
    msgpack_unpacked result;
    msgpack_unpacked_init(&result);
    std::size_t offset = 0;
    auto ret = msgpack_unpack_next(&result, bytes.data(), bytes.size(), &offset);
    benchmark::DoNotOptimize(ret);
    msgpack_unpacked_destroy(&result);
  }
  state.SetItemsProcessed(state.iterations());
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(bytes.size()));
}
BENCHMARK(BM_MsgpackCUnpackEventOnly);

void BM_JsonCompactBatchOf50Records(benchmark::State& state) {
  std::vector<Value> records;
  for (int i = 0; i < kRecordsPerBatch; ++i) records.push_back(eventRecord(i));
  std::string batch;
  for (auto _ : state) {
    batch.clear();
    batch += "{\"events\":[";
    for (std::size_t i = 0; i < records.size(); ++i) {
      if (i > 0) batch += ',';
      json::writeTo(batch, records[i]);
    }
    batch += "]}";
    benchmark::DoNotOptimize(batch.data());
  }
  const auto records_done = state.iterations() * kRecordsPerBatch;
  state.SetItemsProcessed(records_done);
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(batch.size()));
  state.counters["record_bytes"] = static_cast<double>(batch.size()) / kRecordsPerBatch;
  state.counters["ns_per_record"] =
      benchmark::Counter(static_cast<double>(records_done), benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_JsonCompactBatchOf50Records);

// The same batch as posted: compact JSON, then gzip at zlib's default level.
void BM_GzipDeflateBatchOf50Records(benchmark::State& state) {
  std::string batch = "{\"events\":[";
  for (int i = 0; i < kRecordsPerBatch; ++i) {
    if (i > 0) batch += ',';
    json::writeTo(batch, eventRecord(i));
  }
  batch += "]}";
  std::size_t compressed = 0;
  log::setLevel(log::Level::Error);  // the success line would dominate the timing
  for (auto _ : state) {
    auto out = gzipDeflate(batch);
    compressed = out ? out->size() : 0;
    benchmark::DoNotOptimize(out);
  }
  log::setLevel(log::Level::Info);
  const auto records_done = state.iterations() * kRecordsPerBatch;
  state.SetItemsProcessed(records_done);
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(batch.size()));
  state.counters["compressed_bytes"] = static_cast<double>(compressed);
  state.counters["ns_per_record"] =
      benchmark::Counter(static_cast<double>(records_done), benchmark::Counter::kIsRate | benchmark::Counter::kInvert);
}
BENCHMARK(BM_GzipDeflateBatchOf50Records);

void BM_JsonParseBatchOf50Records(benchmark::State& state) {
  std::string batch = "[";
  for (int i = 0; i < kRecordsPerBatch; ++i) {
    if (i > 0) batch += ',';
    json::writeTo(batch, eventRecord(i));
  }
  batch += "]";
  for (auto _ : state) {
    auto parsed = json::parse(batch);
    benchmark::DoNotOptimize(parsed);
  }
  state.SetItemsProcessed(state.iterations() * kRecordsPerBatch);
  state.SetBytesProcessed(state.iterations() * static_cast<std::int64_t>(batch.size()));
}
BENCHMARK(BM_JsonParseBatchOf50Records);

}  // namespace

BENCHMARK_MAIN();
