#include "tools/receiving/gunzip.h"

#include <zlib.h>

#include <algorithm>
#include <array>

#include "tools/files/file_io.h"

namespace tarnel::lab {
namespace {

constexpr int kGzipOnly = 16 + MAX_WBITS;

class Inflater {
 public:
  Inflater() { ready_ = inflateInit2(&stream_, kGzipOnly) == Z_OK; }
  ~Inflater() {
    if (ready_) inflateEnd(&stream_);
  }
  Inflater(const Inflater&) = delete;
  Inflater& operator=(const Inflater&) = delete;

  bool ready() const { return ready_; }
  z_stream& stream() { return stream_; }

 private:
  z_stream stream_{};
  bool ready_ = false;
};

Error gzipError(const std::string& text) {
  return Error(kToolErrorDomain, -1, "gzip: " + text);
}

}  // namespace

MaybeError gunzipTo(std::string_view input, uint64_t maxBytes,
                    const std::function<MaybeError(std::string_view)>& sink) {
  Inflater inflater;
  if (!inflater.ready()) return gzipError("no memory");
  if (input.empty()) return gzipError("the body is empty");
  if (input.size() > UINT32_MAX) return gzipError("too large");
  z_stream& stream = inflater.stream();
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(input.data()));  // zlib reads it only
  stream.avail_in = static_cast<uInt>(input.size());
  uint64_t total = 0;
  std::array<char, 16384> chunk;
  for (;;) {
    stream.next_out = reinterpret_cast<Bytef*>(chunk.data());
    stream.avail_out = static_cast<uInt>(chunk.size());
    const int result = inflate(&stream, Z_NO_FLUSH);
    const size_t count = chunk.size() - stream.avail_out;
    total += count;
    if (total > maxBytes) return gzipError("unpacks to more than " + std::to_string(maxBytes) + " bytes");
    if (MaybeError error = sink({chunk.data(), count})) return error;
    if (result == Z_STREAM_END) {
      if (stream.avail_in == 0) return std::nullopt;
      if (inflateReset(&stream) != Z_OK) return gzipError("cannot go on after the first member");
    } else if (result == Z_BUF_ERROR || (result == Z_OK && stream.avail_in == 0 && stream.avail_out != 0)) {
      return gzipError("ends before its end: it was cut off");
    } else if (result != Z_OK) {
      return gzipError(stream.msg != nullptr ? stream.msg : "damaged");
    }
  }
}

Result<std::string> gunzip(std::string_view input, size_t maxBytes) {
  std::string output;
  const MaybeError error = gunzipTo(input, maxBytes, [&output](std::string_view piece) -> MaybeError {
    output.append(piece);
    return std::nullopt;
  });
  if (error) return *error;
  return output;
}

}  // namespace tarnel::lab
