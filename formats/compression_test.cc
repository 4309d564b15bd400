#include "formats/compression.h"

#include <gtest/gtest.h>

#include <random>
#include <thread>
#include <utility>
#include <vector>

#include "formats/compression_internal.h"
#include "platform/fake/fake_log.h"

namespace tarnel {
namespace {

using detail::compressWith;
using detail::DeflateStream;
using detail::IdleStreams;
using detail::kZlibCalls;
using detail::ZlibCalls;

constexpr int kAnyWrapper = 15 + 32;

std::string inflated(std::string_view compressed, int windowBits = kAnyWrapper) {
  z_stream stream{};
  if (inflateInit2(&stream, windowBits) != Z_OK) return "no inflater";
  std::string out(1U << 20U, '\0');
  stream.next_in = reinterpret_cast<const Bytef*>(compressed.data());
  stream.avail_in = static_cast<uInt>(compressed.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int code = inflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return code == Z_STREAM_END ? out : "not a whole stream";
}

std::string eventText(size_t events) {
  std::string text;
  for (size_t i = 0; i < events; ++i) {
    text += "{\"_eid\":" + std::to_string(i) + ",\"jitter\":" + std::to_string(i * 7919 % 1000) +
            ",\"codec\":\"opus\",\"framesDropped\":0}";
  }
  return text;
}

std::string noise(size_t length, unsigned seed) {
  std::mt19937 generator(seed);
  std::string text(length, '\0');
  for (char& c : text) c = static_cast<char>(generator());
  return text;
}

// What the fake calls below were told, and what they answer.
struct FakeZlib {
  int initCode = Z_OK;
  std::vector<int> deflateCodesBefore;  // answered first, each after one more byte
  int deflateCode = Z_STREAM_END;
  int resetCode = Z_OK;
  const char* message = nullptr;
  int level = 0, method = 0, windowBits = 0, memoryLevel = 0, strategy = -1, streamSize = 0;
  std::string version;
  int flush = 0;
  std::vector<unsigned> rooms;  // for output, at each call of deflate
  int inits = 0, resets = 0, ends = 0;
};
FakeZlib fakeZlib;

const ZlibCalls kFakeCalls = {[](z_stream* stream, int level, int method, int windowBits, int memoryLevel,
                                 int strategy, const char* version, int streamSize) {
                                ++fakeZlib.inits;
                                fakeZlib.level = level;
                                fakeZlib.method = method;
                                fakeZlib.windowBits = windowBits;
                                fakeZlib.memoryLevel = memoryLevel;
                                fakeZlib.strategy = strategy;
                                fakeZlib.version = version;
                                fakeZlib.streamSize = streamSize;
                                stream->msg = const_cast<char*>(fakeZlib.message);
                                return fakeZlib.initCode;
                              },
                              [](z_stream*, uLong length) { return length + 100; },
                              [](z_stream* stream, int flush) {
                                fakeZlib.flush = flush;
                                stream->msg = const_cast<char*>(fakeZlib.message);
                                fakeZlib.rooms.push_back(stream->avail_out);
                                if (fakeZlib.deflateCodesBefore.empty()) return fakeZlib.deflateCode;
                                *stream->next_out = 'x';
                                ++stream->total_out;
                                const int code = fakeZlib.deflateCodesBefore.back();
                                fakeZlib.deflateCodesBefore.pop_back();
                                return code;
                              },
                              [](z_stream*) {
                                ++fakeZlib.resets;
                                return fakeZlib.resetCode;
                              },
                              [](z_stream*) {
                                ++fakeZlib.ends;
                                return Z_OK;
                              }};

class CompressionTest : public testing::Test {
 protected:
  void SetUp() override { fakeZlib = {}; }
  void TearDown() override { idle_.clear(); }
  std::optional<std::string> compressWithFakes(CompressionFormat format = CompressionFormat::gzip) {
    return compressWith(kFakeCalls, idle_, log_, format, "input");
  }
  std::vector<fake::FakeLog::Line> errorLines() { return log_.lines(); }

  fake::FakeLog log_;
  IdleStreams idle_;
};

TEST_F(CompressionTest, EmptyInputIsRefused) {
  for (const auto format : {CompressionFormat::gzip, CompressionFormat::zlib}) {
    log_.clear();
    EXPECT_EQ(compressDataWithZlibOrGzip(log_, format, ""), std::nullopt);
    EXPECT_EQ(log_.lines(),
              (std::vector<fake::FakeLog::Line>{
                  {LogLevel::error, "compressDataWithZlibOrGzip: Cannot compress empty DataBuf"}}));
  }
}

TEST_F(CompressionTest, OneByteCompresses) {
  const auto gzip = gzipDeflate(log_, "x");
  ASSERT_TRUE(gzip);
  EXPECT_EQ(inflated(*gzip), "x");
  const auto zlib = compressDataWithZlibOrGzip(log_, CompressionFormat::zlib, "x");
  ASSERT_TRUE(zlib);
  EXPECT_EQ(inflated(*zlib), "x");
}

TEST_F(CompressionTest, GzipHasTheGzipHeaderAndZlibTheZlibHeader) {
  const std::string input = eventText(50);
  const auto gzip = gzipDeflate(log_, input);
  ASSERT_TRUE(gzip);
  EXPECT_EQ(gzip->substr(0, 2), "\x1f\x8b");
  EXPECT_EQ(inflated(*gzip, 31), input);
  const auto zlib = compressDataWithZlibOrGzip(log_, CompressionFormat::zlib, input);
  ASSERT_TRUE(zlib);
  EXPECT_EQ(static_cast<unsigned char>(zlib->front()), 0x78U);  // deflate with a 32 KiB window
  EXPECT_EQ(inflated(*zlib, 15), input);
}

TEST_F(CompressionTest, GzipDeflateIsTheGzipForm) {
  EXPECT_EQ(gzipDeflate(log_, "abc"), compressDataWithZlibOrGzip(log_, CompressionFormat::gzip, "abc"));
}

TEST_F(CompressionTest, LogsBothLengths) {
  const auto gzip = gzipDeflate(log_, std::string(1000, 'a'));
  ASSERT_TRUE(gzip);
  EXPECT_EQ(log_.lines(), (std::vector<fake::FakeLog::Line>{
                              {LogLevel::debug, "compressDataWithZlibOrGzip: Compressed file from 1000 to " +
                                                    std::to_string(gzip->size())}}));
}

TEST_F(CompressionTest, InputThatDoesNotShrinkStillFits) {
  for (const size_t length : {1U, 100U, 70000U, 300000U}) {
    const std::string input = noise(length, 1);
    const auto gzip = gzipDeflate(log_, input);
    ASSERT_TRUE(gzip) << length;
    EXPECT_EQ(inflated(*gzip), input) << length;
  }
}

// Reuse must not show: the bytes are those of a stream made for this input alone.
TEST_F(CompressionTest, ReusedStreamGivesTheSameBytesAsAFreshOne) {
  const std::vector<std::string> inputs = {noise(200000, 2), eventText(500), "x",        eventText(3),
                                           noise(50, 3),     eventText(50),  noise(1, 4)};
  for (const auto format : {CompressionFormat::gzip, CompressionFormat::zlib}) {
    for (const auto& input : inputs) {
      IdleStreams none;
      const auto fresh = compressWith(kZlibCalls, none, log_, format, input);
      none.clear();
      EXPECT_EQ(compressWith(kZlibCalls, idle_, log_, format, input), fresh);
    }
  }
}

TEST_F(CompressionTest, SetsTheStreamUpWithFixedParameters) {
  compressWithFakes(CompressionFormat::gzip);
  EXPECT_EQ(fakeZlib.level, -1);
  EXPECT_EQ(fakeZlib.method, 8);
  EXPECT_EQ(fakeZlib.windowBits, 31);
  EXPECT_EQ(fakeZlib.memoryLevel, 8);
  EXPECT_EQ(fakeZlib.strategy, 0);
  EXPECT_EQ(fakeZlib.version, "1.2.8");
  EXPECT_EQ(fakeZlib.streamSize, static_cast<int>(sizeof(z_stream)));
  EXPECT_EQ(fakeZlib.flush, 4);
  compressWithFakes(CompressionFormat::zlib);
  EXPECT_EQ(fakeZlib.windowBits, 15);
}

TEST_F(CompressionTest, SetUpTextsByCode) {
  const std::vector<std::pair<int, std::string>> rows = {
      {-2, "Invalid parameter passed in to function."},
      {-4, "Insufficient memory."},
      {-6, "The version of zlib.h and the version of the library linked do not match."},
      {-1, "Unknown error code."},
      {-3, "Unknown error code."},
      {-5, "Unknown error code."},
      {1, "Unknown error code."},
      {2, "Unknown error code."}};
  for (const auto& [code, text] : rows) {
    log_.clear();
    fakeZlib = {};
    fakeZlib.initCode = code;
    fakeZlib.message = "details";
    EXPECT_EQ(compressWithFakes(), std::nullopt);
    EXPECT_EQ(log_.lines(), (std::vector<fake::FakeLog::Line>{
                                {LogLevel::error, "compressDataWithZlibOrGzip: deflateInit2() Error: \"" +
                                                      text + "\" Message: \"details\""}}))
        << code;
    EXPECT_EQ(fakeZlib.ends, 0) << "a stream that was never set up is not ended";
  }
}

TEST_F(CompressionTest, DeflateTextsByCode) {
  const std::vector<std::pair<int, std::string>> rows = {
      {-1, "Error occured while reading file."},
      {-2, "The stream state was inconsistent (e.g., next_in or next_out was NULL)."},
      {-3, "The deflate data was invalid or incomplete."},
      {-4, "Memory could not be allocated for processing."},
      {-5, "Ran out of output buffer for writing compressed bytes."},
      {-6, "The version of zlib.h and the version of the library linked do not match."},
      {2, "Unknown error code."},
      {-7, "Unknown error code."}};
  for (const auto& [code, text] : rows) {
    log_.clear();
    fakeZlib = {};
    fakeZlib.deflateCode = code;
    fakeZlib.message = "details";
    EXPECT_EQ(compressWithFakes(), std::nullopt);
    EXPECT_EQ(
        log_.lines(),
        (std::vector<fake::FakeLog::Line>{
            {LogLevel::error, "compressDataWithZlibOrGzip: zlib error while attempting compression: \"" +
                                  text + "\" Message: \"details\""}}))
        << code;
    EXPECT_EQ(fakeZlib.ends, 1) << "the stream is ended, not kept";
    EXPECT_EQ(idle_.take(CompressionFormat::gzip), nullptr);
  }
}

TEST_F(CompressionTest, GoesOnBehindWhatWasProducedUntilTheStreamEnds) {
  fakeZlib.deflateCodesBefore = {Z_OK, Z_OK};
  EXPECT_EQ(compressWithFakes(), "xx");
  // The room is what deflateBound gave, less what was produced; it never grows.
  EXPECT_EQ(fakeZlib.rooms, (std::vector<unsigned>{105, 104, 103}));
}

TEST_F(CompressionTest, MissingZlibMessageIsEmpty) {
  fakeZlib.initCode = Z_VERSION_ERROR;
  compressWithFakes();
  EXPECT_TRUE(log_.lines().at(0).text.ends_with(" Message: \"\""));
}

TEST_F(CompressionTest, UsedStreamsAreKeptWithinTheBound) {
  compressWithFakes();
  compressWithFakes();
  EXPECT_EQ(fakeZlib.inits, 1);
  EXPECT_EQ(fakeZlib.resets, 1);
  for (size_t i = 0; i < IdleStreams::kPerFormat + 3; ++i) {
    idle_.put(CompressionFormat::zlib, std::make_unique<DeflateStream>(kFakeCalls));
  }
  size_t kept = 0;
  while (idle_.take(CompressionFormat::zlib) != nullptr) ++kept;
  EXPECT_EQ(kept, IdleStreams::kPerFormat);
}

TEST_F(CompressionTest, FormatsDoNotShareStreams) {
  compressWithFakes(CompressionFormat::gzip);
  compressWithFakes(CompressionFormat::zlib);
  EXPECT_EQ(fakeZlib.inits, 2);
}

TEST_F(CompressionTest, StreamThatCannotBeResetIsReplaced) {
  compressWithFakes();
  fakeZlib.resetCode = Z_STREAM_ERROR;
  EXPECT_TRUE(compressWithFakes());
  EXPECT_EQ(fakeZlib.inits, 2);
  EXPECT_EQ(fakeZlib.ends, 1);
}

TEST_F(CompressionTest, ThreadsCompressSideBySide) {
  const std::string input = eventText(50);
  const auto expected = gzipDeflate(log_, input);
  std::vector<std::thread> threads;
  std::atomic<int> wrong{0};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int round = 0; round < 50; ++round) wrong += gzipDeflate(log_, input) == expected ? 0 : 1;
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(wrong, 0);
}

}  // namespace
}  // namespace tarnel
