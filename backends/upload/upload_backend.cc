#include "backends/upload/upload_backend.h"

#include <cinttypes>
#include <utility>

#include "base/percent_encoding.h"
#include "base/text_format.h"
#include "formats/compression.h"
#include "util/uploads.h"

namespace tarnel {
namespace {

// A text of the profile; what a signed document holds in its place counts as absent.
MaybeString textIn(const MaybeDictionary& profile, const char* key, const std::string& name, Log& log) {
  const Value* value = profile ? profile->find(key) : nullptr;
  if (value == nullptr) return std::nullopt;
  if (const auto* text = value->string()) return *text;
  TARNEL_LOG(log, warning, "UploadBackend(initWithName): %s: %s is not a text and counts as absent",
             name.c_str(), key);
  return std::nullopt;
}

std::string lastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  const size_t slash = path.rfind('/');
  if (slash != std::string_view::npos && path.size() > 1) path.remove_prefix(slash + 1);
  return std::string(path);
}

}  // namespace

std::shared_ptr<UploadBackend> UploadBackend::initWithName(const Dependencies& dependencies,
                                                           const std::string& name,
                                                           const MaybeDictionary& profile,
                                                           const MaybeString& productFamily) {
  const auto url = textIn(profile, "post_url", name, dependencies.log);
  if (!url) {
    TARNEL_LOG(dependencies.log, error, "UploadBackend(initWithName): can't resolve upload post URL.");
    return nullptr;
  }
  auto backend = std::make_shared<UploadBackend>(Private{}, dependencies, name, profile, productFamily);
  backend->setUploadURL(url);
  backend->setDisplayURL(textIn(profile, "display_url", name, dependencies.log));
  return backend;
}

UploadBackend::UploadBackend(Private, const Dependencies& dependencies, const std::string& name,
                             const MaybeDictionary& profile, const MaybeString& productFamily)
    : TarnelBackend(dependencies, name, profile, productFamily) {}

bool UploadBackend::uploadFileAtPath(const std::string& path, const std::string& extensionToken) {
  Log& log = dependencies().log;
  Uploads& uploads = dependencies().uploads;
  TARNEL_LOG(log, debug, "UploadBackend(uploadFileAtPath): Uploading file %s", path.c_str());
  if (!_uploadURL) return false;
  // Its destruction releases it, on every way out.
  const auto file = uploads.files().consume(extensionToken);
  if (file == nullptr || !file->isRegular()) {
    TARNEL_LOG(log, error, "UploadBackend(uploadFileAtPath): Only upload a regular file.");
    return false;
  }
  const uint64_t size = file->size();
  if (size == 0) {
    TARNEL_LOG(log, error, "UploadBackend(uploadFileAtPath): Input file is empty");
    return false;
  }
  if (size > uploads.limits().fileBytes) {
    TARNEL_LOG(log, error,
               "UploadBackend(uploadFileAtPath): %s has %" PRIu64 " bytes; at most %" PRIu64
               " are uploaded (limits.max_upload_bytes)",
               path.c_str(), size, uploads.limits().fileBytes);
    return false;
  }
  const auto place = uploads.enter(size, file->owner());
  if (!place) {
    TARNEL_LOG(log, error,
               "UploadBackend(uploadFileAtPath): %s with %" PRIu64
               " bytes found no room among the uploads under way, whose limit is %" PRIu64 " bytes",
               path.c_str(), size, uploads.limits().bytesUnderWay);
    return false;
  }
  std::string contents = contentsOf(*file, path);
  if (contents.empty()) {
    TARNEL_LOG(log, error, "UploadBackend(uploadFileAtPath): Input file is empty");
    return false;
  }
  auto compressed = gzipDeflate(log, contents);
  contents = std::string();
  return compressed && post(path, *std::move(compressed), *file);
}

std::string UploadBackend::contentsOf(ClientFile& file, const std::string& path) const {
  auto contents = file.contents();
  if (!contents) {
    TARNEL_LOG(dependencies().log, warning, "UploadBackend(uploadFileAtPath): %s cannot be read: %s",
               path.c_str(), contents.error().localizedDescription().c_str());
    return {};
  }
  if (contents->size() < file.size()) {
    TARNEL_LOG(dependencies().log, warning,
               "UploadBackend(uploadFileAtPath): %s shrank from %" PRIu64 " to %zu bytes while it was read",
               path.c_str(), file.size(), contents->size());
  }
  return *std::move(contents);
}

std::string UploadBackend::requestURL(const std::string& path) const {
  return formatText("%s?uuid=%s&sequence=%u&description=%s%%20(Uploaded%%20by%%20QMX)&filename=%s&raw=true",
                    _uploadURL->c_str(), udid().c_str(), sessionID(),
                    percentEncodedForQuery("Lumora AFRC log").c_str(),
                    percentEncodedForQuery(lastPathComponent(path) + ".gz").c_str());
}

bool UploadBackend::post(const std::string& path, std::string compressed, ClientFile& file) const {
  Log& log = dependencies().log;
  HttpRequest request;
  request.method = "POST";
  request.url = requestURL(path);
  request.headers = {{"Content-Type", "application/octet-stream"}, {"Content-Encoding", "gzip"}};
  request.body = std::make_shared<const std::string>(std::move(compressed));
  const auto result = dependencies().uploads.perform(dependencies().http, std::move(request));
  if (result.error && result.error->domain() == kHttpErrorDomain && result.error->code() == kHttpBadRequest) {
    TARNEL_LOG(log, error, "UploadBackend(uploadFileAtPath): Unable to create URL request");
    return false;
  }
  if (!result.data) {
    TARNEL_LOG(log, error, "UploadBackend(uploadFileAtPath): post %s",
               result.error ? result.error->description().c_str() : "(null)");
    return wasCarriedOut(result);
  }
  const bool isText = isValidUtf8(*result.data);
  TARNEL_LOG(log, debug, "UploadBackend(uploadFileAtPath): sending to |%s|, Json output: %s",
             _uploadURL->c_str(), isText ? result.data->c_str() : "(null)");
  if (isText && result.data->find("success") != std::string::npos) {
    file.requestDeletion();
  } else {
    TARNEL_LOG(
        log, information,
        "UploadBackend(uploadFileAtPath): the server does not say that it took %s (status %d), which stays",
        path.c_str(), result.response ? result.response->statusCode : 0);
  }
  return true;
}

}  // namespace tarnel
