// The storebag's way in: a document in either form, and all that stands between a server's answer and the
// section of the device's environment. The input's first three lines say how the document is served:
//   MODE ENVIRONMENT CLIENT-TYPE   each one character, see Serving
//   value of the answer's Cache-Control; none when the line is empty
//   value of the answer's Last-Modified; none when the line is empty
// The rest is the document. In most modes it is signed here with a key that the daemon trusts.

#include <algorithm>
#include <cmath>
#include <functional>
#include <optional>
#include <string>

#include "formats/cryptography.h"
#include "formats/document.h"
#include "formats/json_writer.h"
#include "platform/fake/fake_world.h"
#include "testing/test_storebag.h"
#include "tests/fuzz/fuzz_target.h"
#include "tests/fuzz/storebag_expectation.h"
#include "tests/fuzz/values.h"
#include "util/storebag.h"

namespace tarnel::fuzz {

const std::set<std::string_view> kMilestones = {"text document",
                                                "binary document",
                                                "malformed",
                                                "beyond small limits",
                                                "deep",
                                                "date",
                                                "data",
                                                "text form reads back",
                                                "outer document",
                                                "other key",
                                                "damaged bag",
                                                "damaged signature",
                                                "no dictionary",
                                                "no section",
                                                "seed falls back to release",
                                                "version missing",
                                                "refresh cycle",
                                                "refresh cycle held to a day",
                                                "max-age of the answer",
                                                "built-in storebag",
                                                "not modified",
                                                "new Last-Modified",
                                                "section"};

namespace {

constexpr int32_t kUntouched = -77;
constexpr char kKnownModified[] = "Tue, 14 Nov 2023 22:13:20 GMT";

// --- the reader ---

void visitLeaves(const Value& value, const std::function<void(const Value&)>& visit) {
  if (const auto* array = value.array()) {
    for (const auto& element : *array) visitLeaves(element, visit);
  } else if (const auto* dictionary = value.dictionary()) {
    for (const auto& entry : *dictionary) visitLeaves(entry.second, visit);
  }
  visit(value);
}

bool inTextYears(Date date) {
  return date.seconds >= -62167219200.0 && date.seconds < 253402300800.0;
}

// Whether the text form can say all of it. A dictionary whose only key is one of the form's own cannot be
// told from what that key stands for.
bool fitsText(const Value& value) {
  bool fits = true;
  visitLeaves(value, [&fits](const Value& leaf) {
    if (leaf.real() != nullptr) fits = fits && std::isfinite(*leaf.real());
    if (leaf.date() != nullptr) fits = fits && inTextYears(*leaf.date());
    const auto* dictionary = leaf.dictionary();
    if (dictionary != nullptr && dictionary->size() == 1) {
      const auto& key = dictionary->begin()->first;
      fits = fits && key != "$date" && key != "$data";
    }
  });
  return fits;
}

bool isPlainJson(const Value& value) {
  bool plain = true;
  visitLeaves(value, [&plain](const Value& leaf) {
    if (leaf.date() != nullptr) reached("date");
    if (leaf.data() != nullptr) reached("data");
    if (leaf.date() != nullptr || leaf.data() != nullptr) plain = false;
  });
  return plain;
}

void requireFinite(const Value& leaf) {
  require(leaf.real() == nullptr || std::isfinite(*leaf.real()), "the text form has finite numbers alone");
}

// Dates and data are dictionaries in the text form, one level deeper and two items more.
constexpr DocumentLimits kRoomy{.bytes = 64U << 20U, .depth = 40, .values = 4U << 20U};

void requireReadsBack(const Value& value, const std::string& written, const char* what) {
  const auto again = parseDocument(written, kRoomy);
  require(static_cast<bool>(again), what);
  require(same(*again, value), what);
}

void checkWriters(const Value& value) {
  const auto binary = writeBinaryDocument(value);
  requireReadsBack(value, binary, "the binary form reads back as it was");
  require(writeBinaryDocument(*parseDocument(binary, kRoomy)) == binary, "the binary form is deterministic");

  const auto text = writeTextDocument(value);
  const auto pretty = writeTextDocument(value, true);
  require(isValidUtf8(text) && text.find('\n') == std::string::npos, "the text form is one line of UTF-8");
  const bool plain = isPlainJson(value);
  if (fitsText(value)) {
    requireReadsBack(value, text, "the text form reads back as it was");
    requireReadsBack(value, pretty, "the indented text form reads back as it was");
    reached("text form reads back");
  }
  std::string json = "kept";
  if (writeJson(value, JsonStyle::compact, json)) {
    require(!plain || json == "kept" + text, "JSON without dates is the text form");
  } else {
    require(json == "kept", "what cannot be written leaves nothing behind");
  }
}

void checkSmallLimits(std::string_view bytes, const Result<Value>& whole) {
  const DocumentLimits small{.bytes = 4096, .depth = 3, .values = 24};
  const auto result = parseDocument(bytes, small);
  if (result) {
    require(whole && same(*result, *whole), "limits do not change what is read");
    require(bytes.size() <= small.bytes && depthOf(*result) <= small.depth, "the limits hold");
    require(countOf(*result) <= small.values, "no more values than allowed");
  } else if (result.error().code() == kDocumentTooLarge) {
    reached("beyond small limits");
  } else {
    require(!whole, "what is well-formed is at most too large");
  }
}

// Reads the bytes, and checks all that holds for what was read.
std::optional<Value> checkedDocument(std::string_view bytes) {
  const auto whole = parseDocument(bytes);
  checkSmallLimits(bytes, whole);
  if (!whole) {
    require(whole.error().domain() == kDocumentErrorDomain, "the error's domain");
    const bool namesPlace =
        bytes.empty() || whole.error().localizedDescription().find(" at byte ") != std::string::npos;
    require(namesPlace, "the error names the byte");
    reached("malformed");
    return std::nullopt;
  }
  const bool isText = static_cast<uint8_t>(bytes.front()) < 0x80 || bytes.front() == '\xEF';
  if (isText) visitLeaves(*whole, requireFinite);
  reached(isText ? "text document" : "binary document");
  const auto depth = depthOf(*whole);
  require(depth <= DocumentLimits().depth, "no deeper than allowed");
  if (depth > 16) reached("deep");
  checkWriters(*whole);
  return *whole;
}

// --- the fetch ---

struct Serving {
  char mode = 's';  // see answerFor()
  EnvironmentType environment = EnvironmentType::none;
  int32_t clientType = 0;
  MaybeString cacheControl;
  MaybeString lastModified;

  explicit Serving(InputReader& input) {
    const auto first = input.line() + "s48";
    mode = first[0];
    environment = static_cast<EnvironmentType>(static_cast<uint8_t>(first[1]) % 5);
    clientType = static_cast<uint8_t>(first[2]) % 20;
    if (auto text = input.line(); !text.empty()) cacheControl = text;
    if (auto text = input.line(); !text.empty()) lastModified = text;
  }
};

std::string signedBody(std::string_view document, const fake::StorebagSigner& signer) {
  const bool isText = !document.empty() && static_cast<uint8_t>(document.front()) < 0x80;
  return signer.signedBag(document, isText ? fake::DocumentForm::text : fake::DocumentForm::binary);
}

std::string damagedBody(std::string_view document, std::string_view what) {
  auto outer = *parseDocument(signedBody(document, fake::StorebagSigner::shared()))->dictionary();
  auto bytes = *base64Decode(*findString(outer, what));
  if (bytes.empty()) bytes.push_back(1);
  bytes[bytes.size() / 2] = static_cast<uint8_t>(bytes[bytes.size() / 2] ^ 4U);
  outer.set(what, base64Encode(bytes));
  return writeTextDocument(outer);
}

HttpResult answerFor(const Serving& serving, std::string_view document) {
  std::string body;
  switch (serving.mode) {
    case 'e':  // no server
      return fake::FakeHttpClient::failure("no server");
    case 'n':  // empty
      break;
    case 'o':  // the document is the outer one
      body = document;
      reached("outer document");
      break;
    case 'k':
      body = signedBody(document, fake::StorebagSigner::foreign());
      break;
    case 'b':
      body = damagedBody(document, "bag");
      break;
    case 'g':
      body = damagedBody(document, "signature");
      break;
    default:
      body = signedBody(document, fake::StorebagSigner::shared());
  }
  std::vector<HttpHeader> headers;
  if (serving.cacheControl) headers.push_back({"Cache-Control", *serving.cacheControl});
  if (serving.lastModified) headers.push_back({"Last-Modified", *serving.lastModified});
  return fake::FakeHttpClient::status(200, std::move(body), std::move(headers));
}

struct Fetched {
  std::optional<Dictionary> section;
  int32_t maxAge = kUntouched;
  MaybeString version;
  bool notModified = false;
  MaybeString lastModified = kKnownModified;
  bool threw = false;
};

bool logged(const fake::FakeWorld& world, std::string_view text) {
  return !world.log.startingWith(text).empty();
}

Fetched fetch(fake::FakeWorld& world, int32_t clientType) {
  Fetched fetched;
  try {
    fetched.section = fetchStorebagForEnvironmentAndClientType(
        world.dependencies, clientType,
        {fetched.maxAge, fetched.version, fetched.notModified, &fetched.lastModified});
  } catch (const InvalidArgument&) {
    fetched.threw = true;
  }
  return fetched;
}

void checkSigned(const Fetched& fetched, const Serving& serving, const std::optional<Value>& document) {
  const auto* bag = document ? document->dictionary() : nullptr;
  const auto expected =
      bag == nullptr ? StorebagExpectation() : storebagExpectation(*bag, serving.environment);
  if (bag == nullptr) reached("no dictionary");
  require(fetched.threw == (expected.section != nullptr && expected.version == nullptr),
          "only a missing version is an invalid argument");
  if (fetched.threw) reached("version missing");
  require(fetched.section.has_value() == (expected.section != nullptr && !fetched.threw),
          "the section is found when it is there");
  if (!fetched.section) {
    require(!fetched.version, "no version without a section");
    if (bag != nullptr && !fetched.threw) reached("no section");
    return;
  }
  reached("section");
  require(same(*fetched.section, *expected.section), "the environment's section as it was signed");
  require(fetched.version == *expected.version, "the document's version");
  if (serving.environment == EnvironmentType::seed && findDictionary(*bag, "seed") == nullptr) {
    reached("seed falls back to release");
  }
  if (!expected.refreshCycle) return;
  require(fetched.maxAge == *expected.refreshCycle, "the refresh cycle decides, held to a day");
  reached(fetched.maxAge == kStorebagMaxAgeSeconds ? "refresh cycle held to a day" : "refresh cycle");
}

void checkUnverified(const Fetched& fetched, const fake::FakeWorld& world, const Serving& serving) {
  require(!fetched.section && !fetched.version && !fetched.threw, "nothing unsigned is taken");
  if (serving.mode == 'o') return;
  require(logged(world, "fetchStorebagWithName: Signature can not be verified, "), "the log says so");
  if (serving.mode == 'k') reached("other key");
  if (serving.mode == 'b') reached("damaged bag");
  if (serving.mode == 'g') reached("damaged signature");
}

void checkWithoutServer(const Fetched& fetched, const Serving& serving) {
  const auto isCalvisto = storebagNameForClientType(serving.clientType) == "calvisto";
  const bool expected = isCalvisto && serving.environment != EnvironmentType::none;
  require(fetched.section.has_value() == expected, "the built-in storebag is calvisto's alone");
  require(fetched.maxAge == (expected ? 3600 : kUntouched), "no answer, no maximum age but its own");
  if (expected) reached("built-in storebag");
}

void checkHeaders(const Fetched& fetched, const Serving& serving, std::string_view document) {
  const bool isEmpty = serving.mode == 'n' || (serving.mode == 'o' && document.empty());
  const bool expected = isEmpty && serving.lastModified;
  require(fetched.notModified == expected, "not modified is an empty body with the header");
  if (fetched.notModified) {
    reached("not modified");
    require(!fetched.section && fetched.lastModified == kKnownModified, "nothing changes then");
  } else if (fetched.lastModified != kKnownModified) {
    require(fetched.lastModified == serving.lastModified, "only the header's value is kept");
    require(fetched.lastModified->size() <= 1024, "and only one that a header can hold");
    require(fetched.lastModified->find('\r') == std::string::npos &&
                fetched.lastModified->find('\0') == std::string::npos,
            "and can be sent again");
    reached("new Last-Modified");
  }
  if (serving.cacheControl && fetched.maxAge != kStorebagMaxAgeSeconds) reached("max-age of the answer");
  require(fetched.maxAge != kUntouched || serving.cacheControl.value_or("").find("-77") != std::string::npos,
          "an answer gives a maximum age");
}

void checkFetch(const Serving& serving, std::string_view document, const std::optional<Value>& parsed) {
  fake::FakeWorld world;
  world.clientBundle.resources["publicKey.der"] = fake::StorebagSigner::shared().publicKeyDer();
  world.settings.setObject(kTarnelSettingsDomain, "environmentType",
                           static_cast<int64_t>(serving.environment));
  world.http.setAnswer(answerFor(serving, document));
  const auto fetched = fetch(world, serving.clientType);
  if (serving.clientType == 0) {
    require(!fetched.section && world.http.requests().empty(), "type 0 is refused before any request");
    return;
  }
  switch (serving.mode) {
    case 'e':
      return checkWithoutServer(fetched, serving);
    case 'o':
    case 'k':
    case 'b':
    case 'g':
      checkUnverified(fetched, world, serving);
      break;
    case 'n':
      require(!fetched.section && !fetched.threw, "an empty body holds no storebag");
      break;
    default:
      checkSigned(fetched, serving, parsed);
  }
  // A refresh cycle or an exception's record stands in for the header's age.
  if (fetched.section && findNumber(*parsed->dictionary(), "refresh_cycle") != nullptr) return;
  checkHeaders(fetched, serving, document);
}

}  // namespace

void runOne(std::span<const uint8_t> input) {
  InputReader reader(input);
  const Serving serving(reader);
  const auto document = reader.rest();
  const auto parsed = checkedDocument(document);
  // Signing takes longer than all the rest; of what is no storebag anyway, a part is enough.
  const bool isStorebag = parsed && parsed->dictionary() != nullptr;
  constexpr std::string_view kWithoutSigning = "eno";
  if (isStorebag || document.size() % 8 == 0 ||
      kWithoutSigning.find(serving.mode) != std::string_view::npos) {
    checkFetch(serving, document, parsed);
  }
}

}  // namespace tarnel::fuzz
