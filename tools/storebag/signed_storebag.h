#pragma once

#include <string>
#include <string_view>

#include "base/error.h"
#include "base/value.h"
#include "formats/cryptography.h"
#include "tools/storebag/storebag_key.h"

// Outer documents: {"signature": base-64, "bag": base-64 of the inner document's bytes}. The signature
// covers exactly those bytes. Threads: any. Errors carry kToolErrorDomain.

namespace tarnel {

enum class DocumentForm { text, binary };

// Signs the bytes as they stand; nothing is parsed or checked.
Result<std::string> makeSignedStorebag(std::string_view inner, const StorebagKey& key,
                                       DocumentForm form = DocumentForm::text);

// The verified inner document with its own bytes. The error's text begins with the step that failed:
// "outer document: ", "signature: ", "bag: " or "inner document: ".
struct OpenedStorebag {
  Value inner;
  std::string innerBytes;
};
Result<OpenedStorebag> openSignedStorebag(std::string_view outer, const RsaPublicKey& key);
Result<Value> verifySignedStorebag(std::string_view outer, const RsaPublicKey& key);

}  // namespace tarnel
