#include "tools/lab/gunzip.h"

#include <zlib.h>

#include <algorithm>
#include <array>

#include "tools/storebag/file_io.h"

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

Result<std::string> gunzip(std::string_view input, size_t maxBytes) {
  Inflater inflater;
  if (!inflater.ready()) return gzipError("no memory");
  if (input.empty()) return gzipError("the body is empty");
  if (input.size() > UINT32_MAX) return gzipError("too large");
  z_stream& stream = inflater.stream();
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(input.data()));  // zlib reads it only
  stream.avail_in = static_cast<uInt>(input.size());
  std::string output;
  std::array<char, 16384> chunk;
  for (;;) {
    stream.next_out = reinterpret_cast<Bytef*>(chunk.data());
    stream.avail_out = static_cast<uInt>(chunk.size());
    const int result = inflate(&stream, Z_NO_FLUSH);
    const size_t count = chunk.size() - stream.avail_out;
    if (output.size() + count > maxBytes) {
      return gzipError("unpacks to more than " + std::to_string(maxBytes) + " bytes");
    }
    output.append(chunk.data(), count);
    if (result == Z_STREAM_END) {
      if (stream.avail_in == 0) return output;
      if (inflateReset(&stream) != Z_OK) return gzipError("cannot go on after the first member");
    } else if (result == Z_BUF_ERROR || (result == Z_OK && stream.avail_in == 0 && stream.avail_out != 0)) {
      return gzipError("ends before its end: it was cut off");
    } else if (result != Z_OK) {
      return gzipError(stream.msg != nullptr ? stream.msg : "damaged");
    }
  }
}

}  // namespace tarnel::lab
