#include <strings.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <utility>

#include "base/percent_encoding.h"
#include "formats/document.h"
#include "util/storebag_internal.h"

namespace tarnel {
namespace detail {
namespace {

constexpr char kFallbackName[] = "calvisto";
constexpr char kDefaultClientVersion[] = "8.0";
constexpr std::chrono::seconds kRequestTimeout{15};

std::string storebagURL(const Dependencies& dependencies, const MaybeString& name) {
  return storebagServerURL(dependencies) + "/" + printable(name) +
         "?version=" + dependencies.clientBundle.version().value_or(kDefaultClientVersion);
}

// All fields of that name as one value (RFC 9110 section 5.3); nothing when there is none.
MaybeString joinedHeader(const HttpResponse& response, std::string_view name) {
  MaybeString joined;
  for (const auto& header : response.headers) {
    if (header.name.size() != name.size()) continue;
    if (strncasecmp(header.name.data(), name.data(), name.size()) != 0) continue;
    if (joined) *joined += ", ";
    joined = joined.value_or("") + header.value;
  }
  return joined;
}

HttpRequest storebagRequest(Log& log, const std::string& url, const MaybeString* lastModified) {
  HttpRequest request;
  request.url = urlForRequest(url);
  request.timeout = kRequestTimeout;
  if (lastModified != nullptr && *lastModified && isUsableLastModified(**lastModified)) {
    TARNEL_LOG(log, debug, "fetchStorebagWithName: Adding 'Last-Modified: %s' to the header",
               (*lastModified)->c_str());
    request.headers.push_back({"If-Modified-Since", **lastModified});
  }
  return request;
}

std::optional<Dictionary> storebagWithoutServer(Log& log, const std::string& url, const Error& error,
                                                const MaybeString& name) {
  TARNEL_LOG(log, information,
             "fetchStorebagWithName: Error resolving with lookup server %s, sendSynchronousRequest error %s",
             url.c_str(), error.description().c_str());
  if (name != kFallbackName) return std::nullopt;
  TARNEL_LOG(log, information, "fetchStorebagWithName: Loading default storebag '%s'", name->c_str());
  return fallbackStorebag();
}

// Returns true when the server says that the document is the one the slot's value belongs to.
bool updateLastModified(Log& log, const HttpResult& result, MaybeString* slot) {
  const auto* value = result.response ? result.response->header("Last-Modified") : nullptr;
  if (slot == nullptr || value == nullptr) return false;
  const bool bodyIsEmpty = !result.data || result.data->empty();
  if (bodyIsEmpty && *slot) {
    TARNEL_LOG(log, debug,
               "fetchStorebagWithName: storebag content has not changed. using its cached version");
    return true;
  }
  if (!isUsableLastModified(*value)) {
    TARNEL_LOG(log, warning, "fetchStorebagWithName: ignoring 'Last-Modified': no valid header value");
    return false;
  }
  *slot = *value;
  TARNEL_LOG(log, debug, "fetchStorebagWithName: New 'Last-Modified: %s' received", value->c_str());
  return false;
}

// The dictionary in the bytes; nothing when they are no document, or one of another kind.
std::optional<Dictionary> dictionaryOf(Result<Value> document) {
  if (!document) return std::nullopt;
  const auto* dictionary = document->dictionary();
  return dictionary == nullptr ? std::nullopt : std::optional(*dictionary);
}

std::optional<Dictionary> parseOuterDocument(Log& log, std::string_view body) {
  auto document = parseDocument(body);
  if (!document) {
    TARNEL_LOG(log, error, "fetchStorebagWithName: documentWithData error %s",
               document.error().description().c_str());
  }
  return dictionaryOf(std::move(document));
}

std::shared_ptr<const RsaPublicKey> verificationKey(ClientBundle& bundle) {
  const auto der = bundle.resource("publicKey", "der");
  return der ? RsaPublicKey::fromDer(*der) : nullptr;
}

std::optional<Data> decodedEntry(const Dictionary& document, std::string_view key) {
  const auto* text = findString(document, key);
  return text == nullptr ? std::nullopt : base64Decode(*text);
}

// The inner document. Apart from the two cases with a text, an answer is refused without one.
std::optional<Dictionary> verifiedStorebag(const Dependencies& dependencies, std::string_view body) {
  const auto outer = parseOuterDocument(dependencies.log, body);
  if (!outer || findString(*outer, "signature") == nullptr) {
    TARNEL_LOG(dependencies.log, error, "fetchStorebagWithName: Signature is missing");
    return std::nullopt;
  }
  auto key = verificationKey(dependencies.clientBundle);
  if (key == nullptr) return std::nullopt;
  const auto signature = decodedEntry(*outer, "signature");
  if (!signature) return std::nullopt;
  const auto bag = decodedEntry(*outer, "bag");
  if (!bag) return std::nullopt;

  const bool verified = verifyStorebagSignature(*key, *bag, *signature);
  const auto handle = reinterpret_cast<uintptr_t>(key.get());  // only ever printed
  key.reset();
  if (!verified) {
    TARNEL_LOG(dependencies.log, error, "fetchStorebagWithName: Signature can not be verified, %p",
               reinterpret_cast<const void*>(handle));
    return std::nullopt;
  }
  return dictionaryOf(parseDocument({reinterpret_cast<const char*>(bag->data()), bag->size()}));
}

}  // namespace

Dictionary fallbackStorebag() {
  const Dictionary section{{"dravik", Dictionary{{"active", true}}}};
  return {{"orvane_internal", section},
          {"development", section},
          {"release", section},
          {"version", "1.0.0-Calvisto-Fallback"},
          {"refresh_cycle", 3600}};
}

int32_t maxAgeOfResponse(const HttpResponse* response) {
  const auto value = response == nullptr ? MaybeString() : joinedHeader(*response, "Cache-Control");
  if (!value) return kStorebagMaxAgeSeconds;
  bool found = false;
  size_t start = 0;
  while (start <= value->size()) {
    const size_t end = std::min(value->find_first_of("= ", start), value->size());
    const std::string element = value->substr(start, end - start);
    if (found) {
      return Value(element).boundedInt32Value();
    }
    found = element == "max-age";
    start = end + 1;
  }
  return kStorebagMaxAgeSeconds;
}

std::string urlForRequest(std::string_view text) {
  static constexpr std::string_view kNeverInURL = "\"<>\\^`{|}";
  return percentEncoded(text, [](char c) {
    const auto byte = static_cast<unsigned char>(c);
    return byte > 0x20 && byte < 0x7F && kNeverInURL.find(c) == std::string_view::npos;
  });
}

bool isUsableLastModified(std::string_view value) {
  return value.size() <= kMaxLastModifiedLength && std::none_of(value.begin(), value.end(), [](char c) {
           const auto byte = static_cast<unsigned char>(c);
           return (byte < 0x20 && c != '\t') || byte == 0x7F;
         });
}

std::optional<Dictionary> fetchStorebagWithName(const Dependencies& dependencies, const MaybeString& name,
                                                StorebagNameFetchSlots slots) {
  Log& log = dependencies.log;
  const std::string url = storebagURL(dependencies, name);
  TARNEL_LOG(log, debug, "fetchStorebagWithName: Storebag Server URL: %s", url.c_str());
  const auto result = performAndWait(dependencies.http, storebagRequest(log, url, slots.lastModified));
  if (result.error) return storebagWithoutServer(log, url, *result.error, name);

  slots.maxAge = maxAgeOfResponse(result.response ? &*result.response : nullptr);
  if (updateLastModified(log, result, slots.lastModified)) {
    slots.notModified = true;
    return std::nullopt;
  }
  return verifiedStorebag(dependencies, result.data ? std::string_view(*result.data) : std::string_view());
}

}  // namespace detail

bool verifyStorebagSignature(const RsaPublicKey& key, std::span<const uint8_t> bag,
                             std::span<const uint8_t> signature) {
  return key.verifyPkcs1Sha1(sha1(bag), signature);
}

}  // namespace tarnel
