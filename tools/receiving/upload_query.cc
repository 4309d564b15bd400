#include "tools/receiving/upload_query.h"

#include <cctype>

#include "tools/receiving/text.h"

namespace tarnel::lab {
namespace {

constexpr std::string_view kDescription = "Lumora AFRC log (Uploaded by QMX)";
constexpr size_t kMaxUuidBytes = 40;

int digitValue(char digit) {
  if (digit >= '0' && digit <= '9') return digit - '0';
  const char small = static_cast<char>(digit | 0x20);
  return small >= 'a' && small <= 'f' ? small - 'a' + 10 : -1;
}

std::string percentDecoded(std::string_view text) {
  std::string decoded;
  decoded.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    const int high = text[i] == '%' && i + 2 < text.size() ? digitValue(text[i + 1]) : -1;
    const int low = high >= 0 ? digitValue(text[i + 2]) : -1;
    if (low < 0) {
      decoded += text[i];
    } else {
      decoded += static_cast<char>(high * 16 + low);
      i += 2;
    }
  }
  return decoded;
}

// Cuts "&name=value" from the end of the query and returns the value.
MaybeString takeLast(std::string_view& query, std::string_view name) {
  const std::string mark = "&" + std::string(name) + "=";
  size_t at = query.rfind(mark);
  size_t length = mark.size();
  if (at == std::string_view::npos) {
    if (!query.starts_with(mark.substr(1))) return std::nullopt;
    at = 0;
    --length;
  }
  std::string value = percentDecoded(query.substr(at + length));
  query = query.substr(0, at);
  return value;
}

// The same from its beginning, up to the first "&next=".
MaybeString takeFirst(std::string_view& query, std::string_view name, std::string_view next) {
  const std::string mark = std::string(name) + "=";
  if (!query.starts_with(mark)) return std::nullopt;
  const size_t end = std::min(query.find("&" + std::string(next) + "="), query.size());
  std::string value = percentDecoded(query.substr(mark.size(), end - mark.size()));
  query.remove_prefix(std::min(end + 1, query.size()));
  return value;
}

std::string quoted(const std::string& text) {
  return "\"" + printable(text, 80) + "\"";
}

void checkFileName(const std::string& name, Problems& problems) {
  const std::string shown = "query: filename: " + quoted(name);
  if (name.find('/') != std::string::npos) problems.add(shown + " names a folder");
  if (!name.ends_with(".gz") || name.size() == 3) problems.add(shown + " must be a name that ends in .gz");
  if (!isValidUtf8(name)) problems.add(shown + " is not UTF-8");
}

}  // namespace

// The file name is the one value that nothing keeps from looking like the parameters around it, so they are
// taken from both ends.
UploadQuery readUploadQuery(std::string_view query) {
  UploadQuery read;
  read.raw = takeLast(query, "raw");
  read.uuid = takeFirst(query, "uuid", "sequence");
  read.sequence = takeFirst(query, "sequence", "description");
  read.description = takeFirst(query, "description", "filename");
  read.filename = takeLast(query, "filename");
  return read;
}

void checkUploadQuery(const UploadQuery& query, Problems& problems) {
  const auto present = [&problems](const MaybeString& value, const char* name) {
    if (!value) problems.add(std::string("query: ") + name + ": missing");
    return value.has_value();
  };
  if (present(query.uuid, "uuid") && (query.uuid->empty() || query.uuid->size() > kMaxUuidBytes)) {
    problems.add("query: uuid: must have 1 to 40 bytes, but is " + quoted(*query.uuid));
  }
  if (present(query.sequence, "sequence")) {
    const auto number = parseNumber(*query.sequence);
    if (!number || *number > UINT32_MAX) {
      problems.add("query: sequence: must be a number of 32 bits, but is " + quoted(*query.sequence));
    }
  }
  if (present(query.description, "description") && *query.description != kDescription) {
    problems.add("query: description: must be " + quoted(std::string(kDescription)) + ", but is " +
                 quoted(*query.description));
  }
  if (present(query.filename, "filename")) checkFileName(*query.filename, problems);
  if (present(query.raw, "raw") && *query.raw != "true") {
    problems.add("query: raw: must be \"true\", but is " + quoted(*query.raw));
  }
}

}  // namespace tarnel::lab
