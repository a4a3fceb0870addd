// telvane-storebag: makes and inspects signed storebags.
//
//   telvane-storebag keygen --private FILE.pem --public FILE.der
//   telvane-storebag sign --key FILE.pem DOCUMENT ENVELOPE
//   telvane-storebag verify [--public FILE.der] ENVELOPE
//   telvane-storebag show ENVELOPE [--public FILE.der] [--environment N] [--client-type T]
//
// A document is a property list (XML or binary) or JSON, told apart by content; the
// envelope is written as the binary property list the daemon verifies. The public
// key defaults to the daemon's key file. `show` prints, as pretty JSON, the section a
// session of the client type gets in the environment (by default the environment the
// daemon's settings choose), or the whole expanded document without a client type.
//
// Exit status: 0 success, 1 failure (for verify: the envelope does not verify), 2 a
// usage error.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/Json.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "storebag/StorebagDocument.h"
#include "storebag/StorebagEnvelope.h"
#include "storebag/StorebagMacros.h"
#include "storebag/StorebagSigner.h"

namespace {

using namespace telvane;

constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

const char* const kUsage =
    "usage: telvane-storebag keygen --private FILE.pem --public FILE.der\n"
    "       telvane-storebag sign --key FILE.pem DOCUMENT ENVELOPE\n"
    "       telvane-storebag verify [--public FILE.der] ENVELOPE\n"
    "       telvane-storebag show ENVELOPE [--public FILE.der] [--environment N] [--client-type T]\n";

int usage(const std::string& problem) {
  std::cerr << "telvane-storebag: " << problem << "\n" << kUsage;
  return kExitUsage;
}

int failure(const std::string& problem) {
  std::cerr << "telvane-storebag: " << problem << "\n";
  return kExitFailure;
}

// Options ("--name value") and positional arguments of a command.
struct Arguments {
  std::map<std::string, std::string> options;
  std::vector<std::string> positional;
};

std::optional<Arguments> parseArguments(int argc, char** argv, int first, const std::vector<std::string>& known,
                                        std::string& problem) {
  Arguments parsed;
  for (int i = first; i < argc; ++i) {
    std::string argument = argv[i];
    if (argument.rfind("--", 0) == 0) {
      std::string name = argument.substr(2);
      if (std::find(known.begin(), known.end(), name) == known.end()) {
        problem = "unknown option " + argument;
        return std::nullopt;
      }
      if (i + 1 >= argc) {
        problem = "option " + argument + " needs a value";
        return std::nullopt;
      }
      parsed.options[name] = argv[++i];
    } else {
      parsed.positional.push_back(argument);
    }
  }
  return parsed;
}

std::optional<Bytes> readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  Bytes bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (in.bad()) return std::nullopt;
  return bytes;
}

bool writeFile(const std::string& path, const void* data, std::size_t size) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(static_cast<const char*>(data), static_cast<std::streamsize>(size));
  out.close();
  return static_cast<bool>(out);
}

// A property list when the bytes look like one, else JSON.
Result<Value> decodeDocument(const Bytes& bytes) {
  std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  std::size_t start = text.find_first_not_of(" \t\r\n");
  std::string_view trimmed = start == std::string_view::npos ? std::string_view() : text.substr(start);
  if (text.rfind("bplist", 0) == 0 || trimmed.rfind("<", 0) == 0) return plist::decode(bytes);
  return json::parse(text);
}

bool parseInteger(const std::string& text, long long& out) {
  if (text.empty()) return false;
  char* end = nullptr;
  out = std::strtoll(text.c_str(), &end, 10);
  return end && *end == '\0';
}

int keygen(const Arguments& args) {
  if (!args.positional.empty()) return usage("keygen takes no file arguments");
  auto privatePath = args.options.find("private");
  auto publicPath = args.options.find("public");
  if (privatePath == args.options.end() || publicPath == args.options.end()) {
    return usage("keygen needs --private and --public");
  }
  Result<StorebagKeyPair> pair = generateStorebagKeyPair();
  if (!pair) return failure(pair.error());
  if (!writeFile(privatePath->second, pair->privateKeyPem.data(), pair->privateKeyPem.size())) {
    return failure("could not write " + privatePath->second);
  }
  if (!writeFile(publicPath->second, pair->publicKeyDer.data(), pair->publicKeyDer.size())) {
    return failure("could not write " + publicPath->second);
  }
  return 0;
}

int sign(const Arguments& args) {
  auto keyPath = args.options.find("key");
  if (keyPath == args.options.end()) return usage("sign needs --key");
  if (args.positional.size() != 2) return usage("sign needs DOCUMENT and ENVELOPE");
  std::optional<Bytes> pem = readFile(keyPath->second);
  if (!pem) return failure("could not read " + keyPath->second);
  Result<StorebagSigner> signer = StorebagSigner::fromPrivateKeyPem(std::string(pem->begin(), pem->end()));
  if (!signer) return failure(keyPath->second + ": " + signer.error());
  std::optional<Bytes> documentBytes = readFile(args.positional[0]);
  if (!documentBytes) return failure("could not read " + args.positional[0]);
  Result<Value> document = decodeDocument(*documentBytes);
  if (!document) return failure(args.positional[0] + ": " + document.error());
  if (!document->isDictionary()) return failure(args.positional[0] + ": the document is not a dictionary");
  Result<Bytes> envelope = signer->makeEnvelopeForDocument(*document);
  if (!envelope) return failure(envelope.error());
  if (!writeFile(args.positional[1], envelope->data(), envelope->size())) {
    return failure("could not write " + args.positional[1]);
  }
  return 0;
}

std::string publicKeyOption(const Arguments& args) {
  auto found = args.options.find("public");
  return found == args.options.end() ? publicKeyPath() : found->second;
}

int verify(const Arguments& args) {
  if (args.positional.size() != 1) return usage("verify needs ENVELOPE");
  std::optional<Bytes> envelope = readFile(args.positional[0]);
  if (!envelope) return failure("could not read " + args.positional[0]);
  EnvelopeCheck check = checkStorebagEnvelope(*envelope, publicKeyFileLoader(publicKeyOption(args)));
  std::string text = envelopeStatusText(check.status);
  if (!check.detail.empty()) text += ": " + check.detail;
  std::cout << text << "\n";
  return check.status == EnvelopeStatus::Verified ? 0 : kExitFailure;
}

int show(const Arguments& args) {
  if (args.positional.size() != 1) return usage("show needs ENVELOPE");
  long long environment = -1;
  long long clientType = 0;
  auto environmentOption = args.options.find("environment");
  if (environmentOption != args.options.end() &&
      (!parseInteger(environmentOption->second, environment) || environment < 0 || environment > UINT32_MAX)) {
    return usage("--environment needs a number");
  }
  auto clientTypeOption = args.options.find("client-type");
  if (clientTypeOption != args.options.end() &&
      (!parseInteger(clientTypeOption->second, clientType) || clientType < INT32_MIN || clientType > INT32_MAX)) {
    return usage("--client-type needs a number");
  }
  std::optional<Bytes> envelope = readFile(args.positional[0]);
  if (!envelope) return failure("could not read " + args.positional[0]);
  EnvelopeCheck check = checkStorebagEnvelope(*envelope, publicKeyFileLoader(publicKeyOption(args)));
  if (check.status != EnvelopeStatus::Verified) {
    std::string text = envelopeStatusText(check.status);
    return failure(check.detail.empty() ? text : text + ": " + check.detail);
  }
  Value document = applySharedValues(*check.document);

  Value shown = document;
  if (clientTypeOption != args.options.end()) {
    StorebagFetcher fetcher = [&](const std::string&, std::int32_t&, bool&) -> std::optional<Value> {
      return document;
    };
    std::function<std::uint32_t()> chooseEnvironment = [&]() -> std::uint32_t {
      return environment >= 0 ? static_cast<std::uint32_t>(environment) : userDefaultsEnvironment();
    };
    StorebagSelectionResult selected =
        fetchStorebagForEnvironmentAndClientType(static_cast<std::int32_t>(clientType), fetcher, chooseEnvironment);
    if (!selected.selection) return failure("no section for client type " + clientTypeOption->second);
    shown = selected.selection->section;
  }
  Result<std::string> text = json::write(shown, true);
  if (!text) return failure(text.error());
  std::cout << *text << "\n";
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  telvane::log::useStandardError();
  if (argc < 2) return usage("missing command");
  std::string command = argv[1];
  std::vector<std::string> known;
  if (command == "keygen") known = {"private", "public"};
  else if (command == "sign") known = {"key"};
  else if (command == "verify") known = {"public"};
  else if (command == "show") known = {"public", "environment", "client-type"};
  else return usage("unknown command " + command);
  std::string problem;
  std::optional<Arguments> args = parseArguments(argc, argv, 2, known, problem);
  if (!args) return usage(problem);
  if (command == "keygen") return keygen(*args);
  if (command == "sign") return sign(*args);
  if (command == "verify") return verify(*args);
  return show(*args);
}
