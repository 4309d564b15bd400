#include "tools/storebag/signed_storebag.h"

#include "formats/document.h"
#include "tools/files/file_io.h"

namespace tarnel {
namespace {

std::span<const uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

Error stepError(const std::string& text) {
  return Error(kToolErrorDomain, -1, text);
}

Result<Data> decodedMember(const Dictionary& outer, const std::string& key) {
  const Value* value = outer.find(key);
  if (value == nullptr) return stepError(key + ": missing in the outer document");
  const std::string* text = value->string();
  if (text == nullptr) return stepError(key + ": not a text in the outer document");
  std::optional<Data> data = base64Decode(*text);
  if (!data) return stepError(key + ": not base-64");
  return *std::move(data);
}

}  // namespace

Result<std::string> makeSignedStorebag(std::string_view inner, const StorebagKey& key, DocumentForm form) {
  const Result<Data> signature = key.sign(bytesOf(inner));
  if (!signature) return signature.error();
  const Value outer =
      Dictionary{{"signature", base64Encode(*signature)}, {"bag", base64Encode(bytesOf(inner))}};
  return form == DocumentForm::text ? writeTextDocument(outer) : writeBinaryDocument(outer);
}

Result<OpenedStorebag> openSignedStorebag(std::string_view outer, const RsaPublicKey& key) {
  const Result<Value> document = parseDocument(outer);
  if (!document) return stepError("outer document: " + document.error().localizedDescription());
  const Dictionary* members = document->dictionary();
  if (members == nullptr) return stepError("outer document: its top level is not a dictionary");
  const Result<Data> signature = decodedMember(*members, "signature");
  if (!signature) return signature.error();
  const Result<Data> bag = decodedMember(*members, "bag");
  if (!bag) return bag.error();
  if (!key.verifyPkcs1Sha1(sha1(*bag), *signature)) {
    return stepError(
        "signature: does not verify: the bag was changed after signing, or signed with another key than "
        "this public key's");
  }
  OpenedStorebag opened{.inner = {}, .innerBytes = std::string(bag->begin(), bag->end())};
  Result<Value> inner = parseDocument(opened.innerBytes);
  if (!inner) return stepError("inner document: " + inner.error().localizedDescription());
  opened.inner = *std::move(inner);
  return opened;
}

Result<Value> verifySignedStorebag(std::string_view outer, const RsaPublicKey& key) {
  Result<OpenedStorebag> opened = openSignedStorebag(outer, key);
  if (!opened) return opened.error();
  return std::move(opened->inner);
}

}  // namespace tarnel
