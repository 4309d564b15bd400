#pragma once

#ifndef ZLIB_CONST
#define ZLIB_CONST  // next_in points to const bytes
#endif
#include <zlib.h>

#include <array>
#include <atomic>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/log.h"
#include "formats/compression.h"

// Parts of the compression that its tests reach.

namespace tarnel::detail {

// The calls of zlib in use, so that a test can make each of them fail.
struct ZlibCalls {
  int (*init)(z_stream* stream, int level, int method, int windowBits, int memoryLevel, int strategy,
              const char* version, int streamSize);
  uLong (*bound)(z_stream* stream, uLong sourceLength);
  int (*deflate)(z_stream* stream, int flush);
  int (*reset)(z_stream* stream);
  int (*end)(z_stream* stream);
};

// zlib itself.
extern const ZlibCalls kZlibCalls;

// One zlib compression stream; ended with the object. zlib keeps a pointer to it: it never moves.
class DeflateStream {
 public:
  explicit DeflateStream(const ZlibCalls& calls) noexcept : calls_(calls) {}
  DeflateStream(const DeflateStream&) = delete;
  DeflateStream& operator=(const DeflateStream&) = delete;
  ~DeflateStream();

  // Returns zlib's code.
  int setUp(CompressionFormat format);
  // Makes a used stream as good as a new one of the same format.
  bool reset();
  z_stream& stream() noexcept { return stream_; }

 private:
  const ZlibCalls& calls_;
  z_stream stream_{};
  bool live_ = false;
};

// A few set-up streams kept for the next caller: setting one up costs a quarter of a megabyte of cleared
// memory. Bounded for the whole process, because one per thread would be one per connection.
//
// Has no destructor, so that the process-wide one outlives every thread; other owners call clear().
// Threads: any, without a lock.
class IdleStreams {
 public:
  static constexpr size_t kPerFormat = 2;

  // Null when none is idle.
  std::unique_ptr<DeflateStream> take(CompressionFormat format);
  // Ends the stream when there is no room.
  void put(CompressionFormat format, std::unique_ptr<DeflateStream> stream);
  void clear();

 private:
  using Slots = std::array<std::atomic<DeflateStream*>, kPerFormat>;  // owned while not null
  Slots& slots(CompressionFormat format) { return format == CompressionFormat::gzip ? gzip_ : zlib_; }

  Slots gzip_{};
  Slots zlib_{};
};

// compressDataWithZlibOrGzip with these calls and these idle streams.
std::optional<std::string> compressWith(const ZlibCalls& calls, IdleStreams& idle, Log& log,
                                        CompressionFormat format, std::string_view input);

// What a return code of deflateInit2 means; the words differ from those of deflate.
const char* setUpErrorText(int code);
// What a return code of deflate means.
const char* deflateErrorText(int code);

}  // namespace tarnel::detail
