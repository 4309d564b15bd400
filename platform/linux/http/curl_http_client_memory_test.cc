#include <curl/curl.h>

#include <future>

#include "platform/linux/http/curl_test_support.h"
#include "testing/failing_memory.h"

// The client's thread has no memory for what the library hands it.

namespace tarnel {
namespace {

constexpr size_t kLarge = size_t{60} << 10U;

class HttpMemoryTest : public ::testing::Test {
 protected:
  static HttpClientOptions options() {
    HttpClientOptions options = plainOptions();
    options.maxHeldAnswerBytes = 2 * kLarge;
    return options;
  }

  // Runs it to its end, and sets from which size on the client's thread has no memory afterwards.
  HttpResult perform(size_t failsFrom) {
    std::promise<HttpResult> ended;
    client_.startDataTask(get(server_.url()), [&ended, failsFrom](HttpResult result) {
      test::failAllocationsFrom(failsFrom);
      ended.set_value(std::move(result));
    });
    return ended.get_future().get();
  }

  // The first answer is small, the second the given one, those after it as large as may be held.
  void expectOutOfMemoryFor(const std::string& answer) {
    second_ = answer;
    EXPECT_EQ(perform(kLarge / 2).data, "small");
    const HttpResult failed = perform(SIZE_MAX);
    EXPECT_EQ(errorOf(failed, statusBeside_), "out of memory");
    ASSERT_TRUE(failed.error);
    EXPECT_EQ(failed.error->code(), CURLE_OUT_OF_MEMORY);
    for (int i = 0; i < 2; ++i) EXPECT_EQ(perform(SIZE_MAX).data, std::string(2 * kLarge, 'c'));
  }

  int statusBeside_ = 0;
  std::string second_;
  int asked_ = 0;
  RawHttpServer server_{RawHttpServer::answering([this](const std::string& /*request*/) {
    switch (asked_++) {
      case 0:
        return httpAnswer("200 OK", "small");
      case 1:
        return second_;
      default:
        return httpAnswer("200 OK", std::string(2 * kLarge, 'c'));
    }
  })};
  QuietLog log_;
  CurlHttpClient client_{log_, options()};
};

TEST_F(HttpMemoryTest, AHeaderForWhichThereIsNoMemoryEndsItsRequestAlone) {
  expectOutOfMemoryFor("HTTP/1.1 200 OK\r\nX-Large: " + std::string(kLarge, 'h') +
                       "\r\nContent-Length: 0\r\n\r\n");
}

TEST_F(HttpMemoryTest, ABodyForWhichThereIsNoMemoryEndsItsRequestAlone) {
  statusBeside_ = 200;
  expectOutOfMemoryFor(httpAnswer("200 OK", std::string(2 * kLarge, 'b')));
}

}  // namespace
}  // namespace tarnel
