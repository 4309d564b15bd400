#include "tools/lab/print_queue.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <memory>

#include "base/unique_fd.h"
#include "tools/files/file_io.h"

namespace tarnel::lab {
namespace {

using Stream = std::unique_ptr<std::FILE, decltype(&std::fclose)>;

// A reader who takes nothing until asked to, as a stopped terminal does.
class StoppedReader {
 public:
  StoppedReader() {
    std::array<int, 2> ends{};
    EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
    stream_.reset(::fdopen(ends[1], "w"));
    end_ = UniqueFd(ends[0]);
    room_ = static_cast<size_t>(::fcntl(ends[0], F_GETPIPE_SZ));
  }
  std::FILE* stream() const { return stream_.get(); }
  // What it takes before it holds the printing up.
  size_t room() const { return room_; }
  std::string read(size_t bytes) const {
    std::string text(bytes, '\0');
    for (size_t filled = 0; filled < bytes;) {
      const ssize_t count = ::read(end_.get(), text.data() + filled, bytes - filled);
      if (count <= 0) return "(cut short)";
      filled += static_cast<size_t>(count);
    }
    return text;
  }

 private:
  Stream stream_{nullptr, std::fclose};
  UniqueFd end_;
  size_t room_ = 0;
};

TEST(PrintQueueTest, NobodyWaitsForAReaderAndTheOrderStays) {
  const StoppedReader reader;
  PrintQueue queue([](uint64_t) { return PrintQueue::Text{}; });
  std::string all;
  for (int i = 0; all.size() < 4 * reader.room(); ++i) {
    const std::string text = "line " + std::to_string(i) + "\n";
    queue.print({reader.stream(), text});
    all += text;
  }
  EXPECT_EQ(reader.read(all.size()), all);
}

TEST(PrintQueueTest, WhatIsLostIsCountedInItsPlace) {
  const StoppedReader reader;
  const auto lossText = [&reader](uint64_t lost) {
    return PrintQueue::Text{reader.stream(), "lost " + std::to_string(lost) + "\n"};
  };
  PrintQueue queue(lossText, 10);
  // More than the pipe takes; any length is taken while nothing waits.
  const std::string first(reader.room() + 5, 'x');
  queue.print({reader.stream(), first});
  EXPECT_EQ(reader.read(1), "x") << "it is being printed, so that what follows waits";
  for (const char* text : {"12345\n", "1234\n", "6789\n", "123\n"}) queue.print({reader.stream(), text});
  const std::string followed = "12345\nlost 2\n123\n";
  EXPECT_EQ(reader.read(first.size() - 1 + followed.size()).substr(first.size() - 1), followed);
  for (const char* text : {"4", "5"}) queue.print({reader.stream(), text});
  EXPECT_EQ(reader.read(2), "45") << "what is lost is told once";
}

TEST(PrintQueueTest, TheEndWaitsForThePrinting) {
  const Stream file(std::tmpfile(), std::fclose);
  {
    PrintQueue queue([](uint64_t) { return PrintQueue::Text{}; });
    for (int i = 0; i < 1000; ++i) queue.print({file.get(), "x"});
  }
  EXPECT_EQ(std::ftell(file.get()), 1000);
}

}  // namespace
}  // namespace tarnel::lab
