// Storebag envelope check: verify the signature of a signed storebag envelope and
// decode and expand its document, as the daemon does on every storebag use (the key
// file is parsed each time too). The document has 20 backends in each of its four
// environment sections, shared-value macros in every profile, and about 50 KB of
// envelope.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "platform/Log.h"
#include "platform/PropertyList.h"
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

}  // namespace

BENCHMARK_MAIN();
