// Storebag envelope check: verify the signature of a signed storebag envelope and
// decode and expand its document, as the daemon does on every storebag use (the key
// file is parsed each time too). The document has 20 backends in each of its four
// environment sections, shared-value macros in every profile, and about 50 KB of
// envelope.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <string>

#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "platform/Clock.h"
#include "storebag/AgentStorebagCache.h"
#include "storebag/StorebagEnvelope.h"
#include "storebag/StorebagSigner.h"

namespace {

using namespace telvane;

constexpr int kBackendCount = 20;
constexpr std::size_t kTargetEnvelopeBytes = 50 * 1024;

Value makeDocument(std::size_t notesBytes) {
  Dictionary document{{"version", Value("bench-1")},
                      {"refresh_cycle", Value(3600)},
                      {"shared_values", Value(Dictionary{{"==hosts", Value("h1.test,h2.test,h3.test")},
                                                         {"==categories", Value("1,2,3,4,5,6,7,8")}})}};
  for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
    Dictionary backends;
    for (int i = 0; i < kBackendCount; ++i) {
      backends.set("backend" + std::to_string(i),
                   Value(Dictionary{{"active", Value(true)},
                                    {"hosts", Value("==hosts")},
                                    {"filters", Value(Array{Value("==categories"),
                                                            Value(Dictionary{{"deny", Value("==categories")}})})},
                                    {"url", Value("https://collector.test/post/" + std::to_string(i))},
                                    {"notes", Value(std::string(notesBytes, 'n'))}}));
    }
    document.set(section, Value(std::move(backends)));
  }
  return Value(std::move(document));
}

struct Fixture {
  Bytes envelope;
  Bytes publicKeyDer;
};

const Fixture& fixture() {
  static const Fixture made = [] {
    Fixture f;
    StorebagKeyPair keys = generateStorebagKeyPair().value();
    StorebagSigner signer = StorebagSigner::fromPrivateKeyPem(keys.privateKeyPem).value();
    // Grow the per-profile padding until the envelope reaches the target size.
    std::size_t notes = 0;
    do {
      f.envelope = signer.makeEnvelopeForDocument(makeDocument(notes)).value();
      notes += 16;
    } while (f.envelope.size() < kTargetEnvelopeBytes);
    f.publicKeyDer = keys.publicKeyDer;
    return f;
  }();
  return made;
}

void BM_VerifyAndDecodeStorebag(benchmark::State& state) {
  log::setLevel(log::Level::Error);  // the macro lines would dominate otherwise
  const Fixture& f = fixture();
  Bytes der = f.publicKeyDer;
  StorebagVerifier verifier([der]() -> std::optional<Bytes> { return der; }, nullptr);
  for (auto _ : state) {
    std::optional<Value> document = verifier.verify("confera", f.envelope, false);
    if (!document) state.SkipWithError("envelope did not verify");
    benchmark::DoNotOptimize(document);
  }
  state.counters["envelope_bytes"] = static_cast<double>(f.envelope.size());
}
BENCHMARK(BM_VerifyAndDecodeStorebag);

void BM_CheckEnvelopeOnly(benchmark::State& state) {
  const Fixture& f = fixture();
  Bytes der = f.publicKeyDer;
  PublicKeyLoader loader = [der]() -> std::optional<Bytes> { return der; };
  for (auto _ : state) {
    EnvelopeCheck check = checkStorebagEnvelope(f.envelope, loader);
    benchmark::DoNotOptimize(check);
  }
}
BENCHMARK(BM_CheckEnvelopeOnly);

// The agent's cache serving a session whose storebag entry is fresh: what every
// session start and every message pays once the storebag has been fetched. Argument:
// 1 with the daemon's info lines (two per call) written to a discarded sink, 0 with
// logging at error level.
void BM_AgentCacheStorebagForSession(benchmark::State& state) {
  const bool infoLogging = state.range(0) != 0;
  log::setLevel(infoLogging ? log::Level::Info : log::Level::Error);
  // The log lines go to standard error: point it at /dev/null for the run.
  int savedStderr = -1;
  if (infoLogging) {
    std::fflush(stderr);
    savedStderr = ::dup(STDERR_FILENO);
    int null = ::open("/dev/null", O_WRONLY);
    ::dup2(null, STDERR_FILENO);
    ::close(null);
  }
  std::recursive_mutex agentLock;
  Value section = makeDocument(0)["release"];
  AgentStorebagCache cache(
      agentLock,
      [&section](std::int32_t) {
        StorebagSelectionResult result;
        result.selection = StorebagSelection{section, 3600, "bench-1"};
        result.maxAgeSeconds = 3600;
        return result;
      },
      [](const std::string&) -> std::optional<double> { return std::nullopt; }, Clock::system());
  cache.fetchAndCacheStorebag(7);
  for (auto _ : state) {
    std::optional<Value> found = cache.storebagForSession(42, 11);
    if (!found) state.SkipWithError("no cached section");
    benchmark::DoNotOptimize(found);
  }
  if (savedStderr >= 0) {
    std::fflush(stderr);
    ::dup2(savedStderr, STDERR_FILENO);
    ::close(savedStderr);
  }
  log::setLevel(log::Level::Error);
}
BENCHMARK(BM_AgentCacheStorebagForSession)->Arg(0)->Arg(1);

}  // namespace

BENCHMARK_MAIN();
