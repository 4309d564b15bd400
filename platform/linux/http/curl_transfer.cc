#include "platform/linux/http/curl_transfer.h"

#include <openssl/ssl.h>
#include <sys/socket.h>

#include <algorithm>
#include <utility>

#include "platform/linux/http/http_request_check.h"

namespace tarnel::detail {
namespace {

// By taking fewer bytes than they were offered, the callbacks for an answer end the transfer.
constexpr size_t kRefused = 0;

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

bool isRedirect(int status) {
  return status == 301 || status == 302 || status == 303 || status == 307 || status == 308;
}

Error tooLarge(std::string text) {
  return {kHttpErrorDomain, CURLE_FILESIZE_EXCEEDED, std::move(text)};
}

// The server may have taken the request, and only the answer was lost.
Error notSentAgain() {
  return {kHttpErrorDomain, CURLE_GOT_NOTHING,
          "the server gave no answer; what was sent may have arrived and is not sent again"};
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
  received_ = 0;
  headers_.clear();
  headerBytes_ = 0;
  headersEnded_ = false;
}

std::optional<std::string> CurlTransfer::begin(CurlEasy easy) {
  easy_ = std::move(easy);
  if (easy_ == nullptr) return "out of memory";
  curl_easy_reset(easy_.get());
  moved_.reset();
  sent_ = 0;
  bodyRead_ = 0;
  set(CURLOPT_PRIVATE, this);
  set(CURLOPT_URL, request_.url.c_str());
  setMethodAndBody();
  setHeaders();
  setConnection();
  if (setUp_ == CURLE_OK) return std::nullopt;
  return curl_easy_strerror(setUp_);
}

// The library sends a request again by itself when a kept connection ends without a byte of an answer. A body
// is therefore handed out once: the library is given no way to rewind it, and once it was read neither a
// connection is opened (onOpenSocket) nor a sending begun (onConnected). What changes something without
// having a body takes a new connection, on which nothing is sent again.
void CurlTransfer::setMethodAndBody() {
  const bool hasBody = request_.body != nullptr && !request_.body->empty();
  const bool isRepeatable = request_.method == "GET" || request_.method == "HEAD";
  if (!hasBody && !isRepeatable) set(CURLOPT_FRESH_CONNECT, 1L);
  if (request_.body != nullptr || request_.method == "POST") {
    set(CURLOPT_POST, 1L);
    set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(hasBody ? request_.body->size() : 0));
    set(CURLOPT_READFUNCTION, &CurlTransfer::onRead);
    set(CURLOPT_READDATA, this);
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
  set(CURLOPT_MAXAGE_CONN, static_cast<long>(options.idleConnection.count()));
  set(CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(options.connectTimeout.count()));
  set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
  // The certificates were parsed once; the library would read its own file for every connection.
  set(CURLOPT_CAINFO, static_cast<char*>(nullptr));
  set(CURLOPT_CAPATH, static_cast<char*>(nullptr));
  set(CURLOPT_SSL_CTX_FUNCTION, &CurlTransfer::onTls);
  set(CURLOPT_SSL_CTX_DATA, context_.certificates);
  set(CURLOPT_OPENSOCKETFUNCTION, &CurlTransfer::onOpenSocket);
  set(CURLOPT_OPENSOCKETDATA, this);
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

// What the library is about to do, it would do for a second sending.
bool CurlTransfer::refuseSecondSending() {
  if (bodyRead_ == 0) return false;
  refusal_ = notSentAgain();
  return true;
}

curl_socket_t CurlTransfer::onOpenSocket(void* self, curlsocktype /*purpose*/, curl_sockaddr* address) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded<curl_socket_t>(CURL_SOCKET_BAD, [transfer, address] {
    if (transfer->refuseSecondSending()) return CURL_SOCKET_BAD;
    return socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
  });
}

// Comes before a hop's first byte, on a new connection as on a kept one.
int CurlTransfer::onConnected(void* self, char* /*remote*/, char* /*local*/, int /*remotePort*/,
                              int /*localPort*/) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded(CURL_PREREQFUNC_ABORT, [transfer] {
    transfer->noteMoved();
    return transfer->refuseSecondSending() ? CURL_PREREQFUNC_ABORT : CURL_PREREQFUNC_OK;
  });
}

size_t CurlTransfer::onRead(char* into, size_t size, size_t count, void* self) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded<size_t>(
      CURL_READFUNC_ABORT, [transfer, into, size, count] { return transfer->readBody(into, size * count); });
}

size_t CurlTransfer::readBody(char* into, size_t atMost) {
  if (request_.body == nullptr) return 0;
  const size_t count = request_.body->copy(into, atMost, bodyRead_);
  bodyRead_ += count;
  return count;
}

int CurlTransfer::onProgress(void* self, curl_off_t /*downTotal*/, curl_off_t /*down*/,
                             curl_off_t /*upTotal*/, curl_off_t up) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded(1, [transfer, up] {
    if (up != std::exchange(transfer->sent_, up)) transfer->noteMoved();
    return 0;
  });
}

size_t CurlTransfer::onBody(char* bytes, size_t size, size_t count, void* self) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded<size_t>(kRefused, [transfer, bytes, size, count] {
    return transfer->receiveBody({bytes, size * count});
  });
}

size_t CurlTransfer::onHeader(char* bytes, size_t size, size_t count, void* self) {
  auto* const transfer = static_cast<CurlTransfer*>(self);
  return transfer->guarded<size_t>(kRefused, [transfer, bytes, size, count] {
    return transfer->receiveHeader({bytes, size * count});
  });
}

size_t CurlTransfer::receiveBody(std::string_view bytes) {
  noteMoved();
  const HttpClientOptions& options = context_.options;
  const size_t most = isAnswered() ? options.maxUnwantedBytes : options.maxAnswerBytes;
  if (received_ > most || bytes.size() > most - received_) {
    refusal_ = tooLarge("the answer is larger than " + std::to_string(most) + " bytes");
    return kRefused;
  }
  received_ += bytes.size();
  if (!request_.wantsBody) return bytes.size();
  if (context_.heldAnswerBytes + bytes.size() > options.maxHeldAnswerBytes) {
    refusal_ = tooLarge("the answers that are arriving are larger than " +
                        std::to_string(options.maxHeldAnswerBytes) + " bytes together");
    return kRefused;
  }
  data_ += bytes;
  context_.heldAnswerBytes += bytes.size();
  return bytes.size();
}

size_t CurlTransfer::receiveHeader(std::string_view line) {
  noteMoved();
  headerBytes_ += line.size();
  if (headerBytes_ > context_.options.maxHeaderBytes) {
    refusal_ = tooLarge("the answer's headers are larger than " +
                        std::to_string(context_.options.maxHeaderBytes) + " bytes");
    return kRefused;
  }
  if (received_ != 0) return line.size();  // trailers
  if (line.starts_with("HTTP/")) {
    headers_.clear();  // what came before belonged to an interim answer
    headersEnded_ = false;
  } else if (line == "\r\n" || line == "\n") {
    headersEnded_ = true;
    if (!request_.wantsBody && hasFinalHeaders()) context_.answered.push_back(id_);
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

int CurlTransfer::status() const {
  long status = 0;
  curl_easy_getinfo(easy_.get(), CURLINFO_RESPONSE_CODE, &status);
  return static_cast<int>(status);
}

// An interim answer's headers are not final, nor are those that lead elsewhere.
bool CurlTransfer::hasFinalHeaders() const {
  if (!headersEnded_ || status() < 200) return false;
  return !isRedirect(status()) ||
         std::none_of(headers_.begin(), headers_.end(), [](const HttpHeader& header) {
           return equalIgnoringCase(header.name, "Location") && !header.value.empty();
         });
}

bool CurlTransfer::isAnswered() const {
  if (request_.wantsBody || !hasFinalHeaders()) return false;
  // A server that says no before it has read all is sent no more; one that says yes early goes on reading.
  if (status() >= 300 || request_.body == nullptr) return true;
  curl_off_t sent = 0;
  curl_easy_getinfo(easy_.get(), CURLINFO_SIZE_UPLOAD_T, &sent);
  return static_cast<size_t>(sent) >= request_.body->size();
}

Result<CurlTransfer::Next> CurlTransfer::followRedirect() {
  char* target = nullptr;
  curl_easy_getinfo(easy_.get(), CURLINFO_REDIRECT_URL, &target);
  if (!isRedirect(status()) || target == nullptr) return Next::finished;
  if (++redirects_ > context_.options.maxRedirects) {
    return Error(kHttpErrorDomain, CURLE_TOO_MANY_REDIRECTS,
                 "more than " + std::to_string(context_.options.maxRedirects) + " redirects");
  }
  if (auto refused = redirectTo(target, status())) return *refused;
  dropAnswer();
  return Next::hop;
}

MaybeError CurlTransfer::redirectTo(const std::string& url, int status) {
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

Error CurlTransfer::errorOf(CURLcode code) {
  if (isOutOfMemory_) return {kHttpErrorDomain, CURLE_OUT_OF_MEMORY, "out of memory"};
  if (refusal_) return *std::move(refusal_);
  if (code == CURLE_SEND_FAIL_REWIND) return notSentAgain();
  const std::string detail(errorText_.data());
  return {kHttpErrorDomain, code, curl_easy_strerror(code) + (detail.empty() ? "" : ": " + detail)};
}

HttpResult CurlTransfer::failure(Error error) {
  HttpResult result;
  if (hasFinalHeaders()) result.response = takeResponse();
  result.error = std::move(error);
  return result;
}

HttpResult CurlTransfer::result(CURLcode code) {
  if (code != CURLE_OK && !isAnswered()) return failure(errorOf(code));
  HttpResult result;
  context_.heldAnswerBytes -= data_.size();
  result.data = std::exchange(data_, std::string());
  result.response = takeResponse();
  return result;
}

}  // namespace tarnel::detail
