#include "tools/tarnelctl/commands/storebag_command.h"

#include <optional>
#include <ostream>
#include <string_view>
#include <utility>
#include <vector>

#include "formats/cryptography.h"
#include "formats/document.h"
#include "tools/files/file_io.h"
#include "tools/storebag/signed_storebag.h"
#include "tools/storebag/storebag_key.h"
#include "tools/storebag/storebag_template.h"
#include "tools/storebag/storebag_validation.h"

namespace tarnel::ctl {
namespace {

constexpr size_t kMaxFileBytes = 16U << 20U;
constexpr mode_t kReadableMode = 0644;

ExitStatus fail(const Terminal& terminal, const std::string& text) {
  terminal.err << "tarnelctl: " << text << '\n';
  return ExitStatus::failed;
}

ExitStatus write(const StorebagOptions& options, const std::string& bytes, const Terminal& terminal) {
  if (options.output.empty()) {
    terminal.out << bytes;
    return ExitStatus::ok;
  }
  if (!options.force && pathExists(options.output)) {
    return fail(terminal, options.output + " exists: choose another name, or --force to replace it");
  }
  if (const auto error = writeFile(options.output, bytes, kReadableMode)) {
    return fail(terminal, error->localizedDescription());
  }
  terminal.err << "written: " << options.output << '\n';
  return ExitStatus::ok;
}

// Prints the findings; true when there is an error among them.
bool report(const Value& inner, const Terminal& terminal) {
  const auto findings = validateStorebag(inner);
  for (const auto& finding : findings) {
    terminal.err << (finding.severity == FindingSeverity::error ? "error:   " : "warning: ")
                 << finding.description() << '\n';
  }
  return hasErrors(findings);
}

std::optional<std::string> read(const std::string& path, const Terminal& terminal) {
  auto bytes = readFile(path, kMaxFileBytes);
  if (bytes) return *std::move(bytes);
  fail(terminal, bytes.error().localizedDescription());
  return std::nullopt;
}

void warnOfPlaceholders(std::string_view document, const Terminal& terminal) {
  if (document.find("{{LAB_URL}}") != std::string_view::npos) {
    terminal.err
        << "warning: {{LAB_URL}}: only tarnel-lab puts an address there, as it serves a plain document: name "
           "your server (storebag new --server)\n";
  }
  if (document.find("{{LAB_DATAGRAM_PORT}}") != std::string_view::npos) {
    terminal.err << "warning: {{LAB_DATAGRAM_PORT}}: only tarnel-lab puts a port there, as it serves a plain "
                    "document: write the port of your server\n";
  }
}

// From a DER file, or from the publicKey.der of a bundle folder.
std::shared_ptr<const RsaPublicKey> publicKey(const std::string& path, const Terminal& terminal) {
  const std::string inBundle = path + "/publicKey.der";
  const auto der = readFile(pathExists(inBundle) ? inBundle : path, kMaxFileBytes);
  if (!der) {
    fail(terminal,
         der.error().localizedDescription() + ": --key takes a publicKey.der or the bundle folder with it");
    return nullptr;
  }
  auto key = RsaPublicKey::fromDer({reinterpret_cast<const uint8_t*>(der->data()), der->size()});
  if (key == nullptr) {
    fail(terminal, path + " is no RSA public key in DER form: make one with tarnelctl storebag keygen");
  }
  return key;
}

bool isSigned(const Value& document) {
  const auto* dictionary = document.dictionary();
  return dictionary != nullptr && dictionary->contains("bag") && dictionary->contains("signature");
}

// The inner document of a signed one, its signature not looked at.
Result<Value> innerUnverified(const Value& outer) {
  const auto* bag = findString(*outer.dictionary(), "bag");
  auto bytes = bag == nullptr ? std::nullopt : base64Decode(*bag);
  if (!bytes) return Error(kToolErrorDomain, -1, "bag: is no base-64 text");
  return parseDocument(std::string_view(reinterpret_cast<const char*>(bytes->data()), bytes->size()));
}

}  // namespace

ExitStatus makeStorebagKey(const StorebagOptions& options, const Terminal& terminal) {
  const std::string keyPath = options.output + "/storebag-key.pem";
  if (!options.force && pathExists(keyPath)) {
    return fail(terminal, keyPath +
                              " exists: every device that trusts it would refuse what a new key signs. "
                              "Choose another folder, or --force to replace it");
  }
  if (const auto error = makeDirectory(options.output, 0755))
    return fail(terminal, error->localizedDescription());
  terminal.err << "making an RSA key of " << options.bits << " bits...\n";
  const auto key = StorebagKey::generate(options.bits);
  if (!key) return fail(terminal, key.error().localizedDescription());
  if (const auto error = key->save(keyPath)) return fail(terminal, error->localizedDescription());
  const std::string bundle = options.output + "/bundle";
  if (const auto error = writeClientBundle(bundle, *key, options.bundleVersion)) {
    return fail(terminal, error->localizedDescription());
  }
  terminal.out << "private key: " << keyPath << " (keep it secret)\n"
               << "bundle:      " << bundle << " (install it on devices, or point TARNEL_BUNDLE to it)\n";
  return ExitStatus::ok;
}

ExitStatus newStorebag(const StorebagOptions& options, const Terminal& terminal) {
  StorebagTemplate from;
  from.version = options.version;
  from.client = options.client;
  from.service = options.service;
  from.baseURL = options.postURL;
  return write(options, writeTextDocument(Value(newStorebagTemplate(from)), true) + "\n", terminal);
}

ExitStatus signStorebag(const StorebagOptions& options, const Terminal& terminal) {
  const auto bytes = read(options.input, terminal);
  if (!bytes) return ExitStatus::failed;
  warnOfPlaceholders(*bytes, terminal);
  const auto inner = parseDocument(*bytes);
  if (!inner) return fail(terminal, options.input + ": " + inner.error().localizedDescription());
  if (isSigned(*inner)) return fail(terminal, options.input + " is signed already: sign its inner document");
  if (report(*inner, terminal) && !options.force) {
    return fail(terminal, "not signed: mend the errors, or --force to sign it as it is");
  }
  const auto key = StorebagKey::load(options.key);
  if (!key) return fail(terminal, key.error().localizedDescription());
  auto outer = makeSignedStorebag(*bytes, *key, options.binary ? DocumentForm::binary : DocumentForm::text);
  if (!outer) return fail(terminal, outer.error().localizedDescription());
  return write(options, *outer, terminal);
}

ExitStatus verifyStorebag(const StorebagOptions& options, const Terminal& terminal) {
  const auto bytes = read(options.input, terminal);
  if (!bytes) return ExitStatus::failed;
  const auto key = publicKey(options.key, terminal);
  if (key == nullptr) return ExitStatus::failed;
  const auto inner = verifySignedStorebag(*bytes, *key);
  if (!inner) return fail(terminal, options.input + ": " + inner.error().localizedDescription());
  const bool usable = !report(*inner, terminal);
  const auto* document = inner->dictionary();
  const auto* version = document == nullptr ? nullptr : findString(*document, "version");
  terminal.out << "signature holds, version " << (version == nullptr ? "missing" : *version) << '\n';
  return usable ? ExitStatus::ok : ExitStatus::failed;
}

ExitStatus showStorebag(const StorebagOptions& options, const Terminal& terminal) {
  const auto bytes = read(options.input, terminal);
  if (!bytes) return ExitStatus::failed;
  auto document = parseDocument(*bytes);
  if (!document) return fail(terminal, options.input + ": " + document.error().localizedDescription());
  if (!isSigned(*document)) {
    terminal.err << "not signed\n";
  } else if (options.key.empty()) {
    terminal.err << "signature not checked: give --key\n";
    document = innerUnverified(*document);
  } else {
    const auto key = publicKey(options.key, terminal);
    if (key == nullptr) return ExitStatus::failed;
    document = verifySignedStorebag(*bytes, *key);
    if (document) terminal.err << "signature holds\n";
  }
  if (!document) return fail(terminal, options.input + ": " + document.error().localizedDescription());
  terminal.out << writeTextDocument(*document, true) << '\n';
  return ExitStatus::ok;
}

}  // namespace tarnel::ctl
