#include "platform/linux/curl_transfer.h"

#include <openssl/ssl.h>

#include <algorithm>
#include <utility>

#include "platform/linux/http_request_check.h"

namespace tarnel::detail {
namespace {

bool hasHeader(const HttpRequest& request, std::string_view name) {
  return std::any_of(request.headers.begin(), request.headers.end(),
                     [name](const HttpHeader& header) { return equalIgnoringCase(header.name, name); });
}

std::string_view trimmed(std::string_view text) {
  constexpr std::string_view kBlanks = " \t\r\n";
  const size_t first = text.find_first_not_of(kBlanks);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kBlanks) - first + 1);
}

bool isRedirect(long status) {
  return status == 301 || status == 302 || status == 303 || status == 307 || status == 308;
}

}  // namespace

CurlTransfer::CurlTransfer(uint64_t id, HttpRequest request, HttpClient::Completion completion,
                           TransferContext& context)
    : id_(id),
      request_(std::move(request)),
      completion_(std::move(completion)),
      context_(context),
      bodyBytes_(request_.body == nullptr ? 0 : request_.body->size()) {}

CurlTransfer::~CurlTransfer() {
  dropAnswer();
}

std::string CurlTransfer::host() const {
  const auto origin = originOf(request_.url);
  return origin ? origin->scheme + "://" + origin->host + ':' + origin->port : request_.url;
}

void CurlTransfer::dropAnswer() {
  context_.heldAnswerBytes -= data_.size();
  data_.clear();
  headers_.clear();
  headerBytes_ = 0;
  headersEnded_ = false;
}

MaybeError CurlTransfer::begin(CurlEasy easy) {
  easy_ = std::move(easy);
  if (easy_ == nullptr) return Error(kHttpErrorDomain, CURLE_OUT_OF_MEMORY, "out of memory");
  curl_easy_reset(easy_.get());
  moved_.reset();
  sent_ = 0;
  set(CURLOPT_PRIVATE, this);
  set(CURLOPT_URL, request_.url.c_str());
  setMethodAndBody();
  setHeaders();
  setConnection();
  if (setUp_ == CURLE_OK) return std::nullopt;
  return Error(kHttpErrorDomain, setUp_,
               std::string("cannot set the request up: ") + curl_easy_strerror(setUp_));
}

void CurlTransfer::setMethodAndBody() {
  if (request_.body != nullptr || request_.method == "POST") {
    static const std::string none;
    const std::string& body = request_.body != nullptr ? *request_.body : none;
    set(CURLOPT_POST, 1L);
    set(CURLOPT_POSTFIELDS, body.data());
    set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(body.size()));
    if (request_.method != "POST") set(CURLOPT_CUSTOMREQUEST, request_.method.c_str());
  } else if (request_.method == "HEAD") {
    set(CURLOPT_NOBODY, 1L);
  } else if (request_.method != "GET") {
    set(CURLOPT_CUSTOMREQUEST, request_.method.c_str());
  }
}

void CurlTransfer::addHeaderLine(const std::string& line) {
  curl_slist* const longer = curl_slist_append(headerList_.get(), line.c_str());
  if (longer == nullptr) {
    setUp_ = CURLE_OUT_OF_MEMORY;
    return;
  }
  static_cast<void>(headerList_.release());
  headerList_.reset(longer);
}

void CurlTransfer::setHeaders() {
  headerList_.reset();
  for (const auto& [name, value] : request_.headers) {
    const auto text = trimmed(value);
    // The library's spelling for a header without a value is a semicolon.
    addHeaderLine(text.empty() ? name + ';' : name + ": " + std::string(text));
  }
  // A name and a colon alone keep the library from adding a header of its own.
  for (const char* own : {"Accept", "Content-Type", "Expect"}) {
    if (!hasHeader(request_, own)) addHeaderLine(std::string(own) + ':');
  }
  set(CURLOPT_HTTPHEADER, headerList_.get());
}

void CurlTransfer::setConnection() {
  const HttpClientOptions& options = context_.options;
  set(CURLOPT_NOSIGNAL, 1L);
  set(CURLOPT_QUICK_EXIT, 1L);  // never wait for a name that is still being looked up
  set(CURLOPT_ERRORBUFFER, errorText_.data());
  set(CURLOPT_PROTOCOLS_STR, "http,https");
  set(CURLOPT_FOLLOWLOCATION, 0L);
  set(CURLOPT_PROXY, "");
  set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
  set(CURLOPT_HTTP_CONTENT_DECODING, 0L);
  set(CURLOPT_TCP_KEEPALIVE, 1L);
  set(CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(options.connectTimeout.count()));
  set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
  // The certificates were parsed once; the library would read its own file for every connection.
  set(CURLOPT_CAINFO, static_cast<char*>(nullptr));
  set(CURLOPT_CAPATH, static_cast<char*>(nullptr));
  set(CURLOPT_SSL_CTX_FUNCTION, &CurlTransfer::onTls);
  set(CURLOPT_SSL_CTX_DATA, context_.certificates);
  set(CURLOPT_PREREQFUNCTION, &CurlTransfer::onConnected);
  set(CURLOPT_PREREQDATA, this);
  set(CURLOPT_NOPROGRESS, 0L);
  set(CURLOPT_XFERINFOFUNCTION, &CurlTransfer::onProgress);
  set(CURLOPT_XFERINFODATA, this);
  set(CURLOPT_WRITEFUNCTION, &CurlTransfer::onBody);
  set(CURLOPT_WRITEDATA, this);
  set(CURLOPT_HEADERFUNCTION, &CurlTransfer::onHeader);
  set(CURLOPT_HEADERDATA, this);
}

CURLcode CurlTransfer::onTls(CURL* /*easy*/, void* context, void* certificates) {
  if (certificates == nullptr) return CURLE_SSL_CACERT_BADFILE;
  SSL_CTX_set1_cert_store(static_cast<SSL_CTX*>(context), static_cast<X509_STORE*>(certificates));
  return CURLE_OK;
}

// Comes before a hop's first byte, on a new connection as on a kept one.
int CurlTransfer::onConnected(void* self, char* /*remote*/, char* /*local*/, int /*remotePort*/,
                              int /*localPort*/) {
  static_cast<CurlTransfer*>(self)->noteMoved();
  return CURL_PREREQFUNC_OK;
}

int CurlTransfer::onProgress(void* self, curl_off_t /*downTotal*/, curl_off_t /*down*/,
                             curl_off_t /*upTotal*/, curl_off_t up) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  if (up != std::exchange(transfer->sent_, up)) transfer->noteMoved();
  return 0;
}

size_t CurlTransfer::onBody(char* bytes, size_t size, size_t count, void* self) {
  return static_cast<CurlTransfer*>(self)->receiveBody({bytes, size * count});
}

size_t CurlTransfer::onHeader(char* bytes, size_t size, size_t count, void* self) {
  return static_cast<CurlTransfer*>(self)->receiveHeader({bytes, size * count});
}

// The callbacks refuse by taking fewer bytes than they were offered.
size_t CurlTransfer::receiveBody(std::string_view bytes) {
  noteMoved();
  const HttpClientOptions& options = context_.options;
  if (bytes.size() > options.maxAnswerBytes - data_.size()) {
    refusal_ = Error(kHttpErrorDomain, CURLE_FILESIZE_EXCEEDED,
                     "the answer is larger than " + std::to_string(options.maxAnswerBytes) + " bytes");
    return 0;
  }
  if (context_.heldAnswerBytes + bytes.size() > options.maxHeldAnswerBytes) {
    refusal_ = Error(kHttpErrorDomain, CURLE_FILESIZE_EXCEEDED,
                     "the answers that are arriving are larger than " +
                         std::to_string(options.maxHeldAnswerBytes) + " bytes together");
    return 0;
  }
  context_.heldAnswerBytes += bytes.size();
  data_ += bytes;
  return bytes.size();
}

size_t CurlTransfer::receiveHeader(std::string_view line) {
  noteMoved();
  headerBytes_ += line.size();
  if (headerBytes_ > context_.options.maxHeaderBytes) {
    refusal_ = Error(
        kHttpErrorDomain, CURLE_FILESIZE_EXCEEDED,
        "the answer's headers are larger than " + std::to_string(context_.options.maxHeaderBytes) + " bytes");
    return 0;
  }
  if (!data_.empty()) return line.size();  // trailers
  if (line.starts_with("HTTP/")) {
    headers_.clear();  // what came before belonged to an interim answer
    headersEnded_ = false;
  } else if (line == "\r\n" || line == "\n") {
    headersEnded_ = true;
  } else if ((line.starts_with(' ') || line.starts_with('\t')) && !headers_.empty()) {
    const auto folded = trimmed(line);
    if (!folded.empty()) headers_.back().value.append(" ").append(folded);
  } else if (const size_t colon = line.find(':'); colon != std::string_view::npos) {
    headers_.push_back(
        {std::string(trimmed(line.substr(0, colon))), std::string(trimmed(line.substr(colon + 1)))});
  }
  return line.size();
}

MaybeError CurlTransfer::incompleteAnswer() const {
  if (headersEnded_) return std::nullopt;
  return Error(kHttpErrorDomain, CURLE_PARTIAL_FILE, "the connection closed inside the answer's headers");
}

Result<CurlTransfer::Next> CurlTransfer::followRedirect() {
  long status = 0;
  char* target = nullptr;
  curl_easy_getinfo(easy_.get(), CURLINFO_RESPONSE_CODE, &status);
  curl_easy_getinfo(easy_.get(), CURLINFO_REDIRECT_URL, &target);
  if (!isRedirect(status) || target == nullptr) return Next::finished;
  if (++redirects_ > context_.options.maxRedirects) {
    return Error(kHttpErrorDomain, CURLE_TOO_MANY_REDIRECTS,
                 "more than " + std::to_string(context_.options.maxRedirects) + " redirects");
  }
  if (auto refused = redirectTo(target, status)) return *refused;
  dropAnswer();
  return Next::hop;
}

MaybeError CurlTransfer::redirectTo(const std::string& url, long status) {
  const auto from = originOf(request_.url);
  const auto to = originOf(url);
  if (!from || !to) {
    return Error(kHttpErrorDomain, CURLE_UNSUPPORTED_PROTOCOL,
                 "refused a redirect to \"" + url + "\": only http and https are supported");
  }
  if (from->scheme == "https" && to->scheme == "http") {
    return Error(kHttpErrorDomain, CURLE_UNSUPPORTED_PROTOCOL,
                 "refused a redirect from https to \"" + url + "\", which is not encrypted");
  }
  // Only 303 says that the request was taken. A POST that became a GET after a 301 or 302 would have the
  // new place's page for its answer, and nobody would have what was posted.
  const bool becomesGet = status == 303 && request_.method != "HEAD";
  if (becomesGet) {
    request_.method = "GET";
    request_.body.reset();
  }
  std::erase_if(request_.headers, [becomesGet, changed = *from != *to](const HttpHeader& header) {
    constexpr std::string_view kContent = "Content-";
    return (becomesGet && equalIgnoringCase(header.name.substr(0, kContent.size()), kContent)) ||
           (changed && (equalIgnoringCase(header.name, "Authorization") ||
                        equalIgnoringCase(header.name, "Cookie") || equalIgnoringCase(header.name, "Host")));
  });
  request_.url = url;
  return std::nullopt;
}

HttpResult CurlTransfer::result(CURLcode code) {
  HttpResult result;
  if (refusal_) {
    result.error = std::move(refusal_);
  } else if (code != CURLE_OK) {
    const std::string detail(errorText_.data());
    result.error =
        Error(kHttpErrorDomain, code, curl_easy_strerror(code) + (detail.empty() ? "" : ": " + detail));
  } else {
    long status = 0;
    curl_easy_getinfo(easy_.get(), CURLINFO_RESPONSE_CODE, &status);
    context_.heldAnswerBytes -= data_.size();
    result.data = std::exchange(data_, std::string());
    result.response = HttpResponse{static_cast<int>(status), std::move(headers_)};
  }
  return result;
}

}  // namespace tarnel::detail
