#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include "backends/https/https_post_backend_fixture.h"
#include "backends/upload/upload_backend.h"
#include "tarnel/keys.h"

// A program of its own: it stands between the whole program and zlib.

namespace {

bool refusesMemory = false;  // for the next stream, once

void* noMemory(void* /*opaque*/, unsigned /*items*/, unsigned /*size*/) {
  return nullptr;
}
void nothingToFree(void* /*opaque*/, void* /*address*/) {}

}  // namespace

extern "C" int deflateInit2_(z_streamp stream, int level, int method, int windowBits, int memoryLevel,
                             int strategy, const char* version, int size) {
  if (refusesMemory) {
    refusesMemory = false;
    stream->zalloc = noMemory;
    stream->zfree = nothingToFree;
  }
  static const auto original = reinterpret_cast<decltype(&deflateInit2_)>(dlsym(RTLD_NEXT, "deflateInit2_"));
  return original(stream, level, method, windowBits, memoryLevel, strategy, version, size);
}

namespace tarnel {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

TEST(UploadBackendMemoryTest, WithoutMemoryToCompressTheBackendIsSilentAndTheFileStays) {
  fake::FakeWorld world;
  world.clientFiles.files["t"] = {.text = "text"};
  world.http.setAnswer(fake::FakeHttpClient::status(200, "success"));
  const auto backend =
      UploadBackend::initWithName(world.dependencies, kTarnelBackendUploadServer,
                                  Dictionary{{"post_url", "https://files.example/up"}}, std::nullopt);
  ASSERT_NE(backend, nullptr);
  refusesMemory = true;
  EXPECT_FALSE(backend->uploadFileAtPath("/x", "t"));
  EXPECT_FALSE(refusesMemory);
  EXPECT_THAT(world.http.requests(), IsEmpty());
  EXPECT_THAT(world.clientFiles.journal, ElementsAre("consume t", "read t", "release t"));
  // The compression tells what is wrong; the backend adds nothing.
  const auto lines = world.log.lines();
  ASSERT_EQ(lines.size(), 2U);
  EXPECT_EQ(lines[0].text, "UploadBackend(uploadFileAtPath): Uploading file /x");
  EXPECT_EQ(lines[1].text,
            "compressDataWithZlibOrGzip: deflateInit2() Error: \"Insufficient memory.\" Message: \"\"");
  // And then again.
  EXPECT_TRUE(backend->uploadFileAtPath("/x", "t"));
  EXPECT_EQ(inflated(*world.http.requests().at(0).body), "text");
}

}  // namespace
}  // namespace tarnel
