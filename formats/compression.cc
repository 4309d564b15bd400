#include "formats/compression.h"

#include <utility>

#include "formats/compression_internal.h"

namespace tarnel {
namespace detail {
namespace {

constexpr int kGzipWindowBits = 31;
constexpr int kZlibWindowBits = 15;
constexpr int kMemoryLevel = 8;
// The oldest zlib whose stream layout this code is written for; zlib compares the first digit.
constexpr char kZlibVersion[] = "1.2.8";

const char* textOrEmpty(const char* text) {
  return text == nullptr ? "" : text;
}

// A stream ready for use, or null after logging why there is none.
std::unique_ptr<DeflateStream> readyStream(const ZlibCalls& calls, IdleStreams& idle, Log& log,
                                           CompressionFormat format) {
  auto stream = idle.take(format);
  if (stream != nullptr && stream->reset()) return stream;
  stream = std::make_unique<DeflateStream>(calls);
  const int code = stream->setUp(format);
  if (code == Z_OK) return stream;
  TARNEL_LOG(log, error, "compressDataWithZlibOrGzip: deflateInit2() Error: \"%s\" Message: \"%s\"",
             setUpErrorText(code), textOrEmpty(stream->stream().msg));
  return nullptr;
}

}  // namespace

const ZlibCalls kZlibCalls = {deflateInit2_, deflateBound, deflate, deflateReset, deflateEnd};

DeflateStream::~DeflateStream() {
  if (live_) calls_.end(&stream_);
}

int DeflateStream::setUp(CompressionFormat format) {
  const int windowBits = format == CompressionFormat::gzip ? kGzipWindowBits : kZlibWindowBits;
  const int code = calls_.init(&stream_, Z_DEFAULT_COMPRESSION, Z_DEFLATED, windowBits, kMemoryLevel,
                               Z_DEFAULT_STRATEGY, kZlibVersion, static_cast<int>(sizeof(z_stream)));
  live_ = code == Z_OK;
  return code;
}

bool DeflateStream::reset() {
  return calls_.reset(&stream_) == Z_OK;
}

std::unique_ptr<DeflateStream> IdleStreams::take(CompressionFormat format) {
  for (auto& slot : slots(format)) {
    if (auto* stream = slot.exchange(nullptr, std::memory_order_acquire)) {
      return std::unique_ptr<DeflateStream>(stream);
    }
  }
  return nullptr;
}

void IdleStreams::put(CompressionFormat format, std::unique_ptr<DeflateStream> stream) {
  for (auto& slot : slots(format)) {
    DeflateStream* empty = nullptr;
    if (slot.compare_exchange_strong(empty, stream.get(), std::memory_order_release,
                                     std::memory_order_relaxed)) {
      static_cast<void>(stream.release());  // the slot owns it now
      return;
    }
  }
}

void IdleStreams::clear() {
  while (take(CompressionFormat::gzip) != nullptr) continue;
  while (take(CompressionFormat::zlib) != nullptr) continue;
}

const char* setUpErrorText(int code) {
  switch (code) {
    case Z_STREAM_ERROR:
      return "Invalid parameter passed in to function.";
    case Z_MEM_ERROR:
      return "Insufficient memory.";
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    default:
      return "Unknown error code.";
  }
}

const char* deflateErrorText(int code) {
  switch (code) {
    case Z_ERRNO:
      return "Error occured while reading file.";
    case Z_STREAM_ERROR:
      return "The stream state was inconsistent (e.g., next_in or next_out was NULL).";
    case Z_DATA_ERROR:
      return "The deflate data was invalid or incomplete.";
    case Z_MEM_ERROR:
      return "Memory could not be allocated for processing.";
    case Z_BUF_ERROR:
      return "Ran out of output buffer for writing compressed bytes.";
    case Z_VERSION_ERROR:
      return "The version of zlib.h and the version of the library linked do not match.";
    default:
      return "Unknown error code.";
  }
}

std::optional<std::string> compressWith(const ZlibCalls& calls, IdleStreams& idle, Log& log,
                                        CompressionFormat format, std::string_view input) {
  if (input.empty()) {
    TARNEL_LOG(log, error, "compressDataWithZlibOrGzip: Cannot compress empty DataBuf");
    return std::nullopt;
  }
  auto owned = readyStream(calls, idle, log, format);
  if (owned == nullptr) return std::nullopt;

  z_stream& stream = owned->stream();
  stream.next_in = reinterpret_cast<const Bytef*>(input.data());
  stream.avail_in = static_cast<uInt>(input.size());
  std::string output(calls.bound(&stream, input.size()), '\0');
  int code = Z_OK;
  while (code == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(output.data()) + stream.total_out;
    stream.avail_out = static_cast<uInt>(output.size() - stream.total_out);
    code = calls.deflate(&stream, Z_FINISH);
  }
  if (code != Z_STREAM_END) {
    TARNEL_LOG(log, error,
               "compressDataWithZlibOrGzip: zlib error while attempting compression: \"%s\" Message: \"%s\"",
               deflateErrorText(code), textOrEmpty(stream.msg));
    return std::nullopt;
  }
  output.resize(stream.total_out);
  output.shrink_to_fit();  // it may wait for a slow server
  idle.put(format, std::move(owned));
  TARNEL_LOG(log, debug, "compressDataWithZlibOrGzip: Compressed file from %u to %u",
             static_cast<unsigned>(input.size()), static_cast<unsigned>(output.size()));
  return output;
}

}  // namespace detail

std::optional<std::string> compressDataWithZlibOrGzip(Log& log, CompressionFormat format,
                                                      std::string_view input) {
  static constinit detail::IdleStreams idle;
  return detail::compressWith(detail::kZlibCalls, idle, log, format, input);
}

std::optional<std::string> gzipDeflate(Log& log, std::string_view input) {
  return compressDataWithZlibOrGzip(log, CompressionFormat::gzip, input);
}

}  // namespace tarnel
