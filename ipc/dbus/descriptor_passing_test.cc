#include "ipc/dbus/descriptor_passing.h"

#include <gtest/gtest.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <string>

#include "ipc/server/ipc_test_support.h"

namespace tarnel {
namespace {

ssize_t sendWithDescriptors(int socket, std::string_view bytes, const std::vector<UniqueFd>& descriptors) {
  std::array<int, wire::kMaxDescriptors> numbers{};
  if (descriptors.size() > numbers.size()) {
    errno = EINVAL;
    return -1;
  }
  std::transform(descriptors.begin(), descriptors.end(), numbers.begin(),
                 [](const UniqueFd& descriptor) { return descriptor.get(); });
  alignas(cmsghdr) std::array<char, CMSG_SPACE(sizeof(int) * wire::kMaxDescriptors)> control{};
  iovec piece{const_cast<char*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  if (!descriptors.empty()) {
    message.msg_control = control.data();
    message.msg_controllen = CMSG_SPACE(sizeof(int) * descriptors.size());
    auto* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int) * descriptors.size());
    std::memcpy(control.data() + CMSG_LEN(0), numbers.data(), sizeof(int) * descriptors.size());
  }
  return sendmsg(socket, &message, MSG_DONTWAIT | MSG_NOSIGNAL);
}

TEST(AnnouncedDescriptorsTest, TheHeaderSaysHowMany) {
  for (const uint32_t count : {0U, 1U, 4U, 0xFFFFFFFFU}) {
    const auto call = rawCall("UploadFile", "", "sh", 0, 1, count);
    EXPECT_EQ(headerSize(call), call.size());
    EXPECT_EQ(announcedDescriptors(call), count);
  }
}

TEST(AnnouncedDescriptorsTest, BothByteOrdersAreRead) {
  const std::string big("B\1\0\1\0\0\0\0\0\0\0\1\0\0\0\x08\x09\1u\0\0\0\0\3", 24);
  EXPECT_EQ(headerSize(big), 24U);
  EXPECT_EQ(announcedDescriptors(big), 3U);
}

// Whatever a header holds, reading stays inside it.
TEST(AnnouncedDescriptorsTest, WhateverIsCutOrChangedIsReadWithinItsBounds) {
  const auto call = rawCall("UploadFile", "", "sh", 0, 1, 2);
  for (size_t length = 16; length < call.size(); ++length) {
    std::string cut = call.substr(0, length);
    const auto fields = static_cast<uint32_t>(length - 16);
    std::memcpy(cut.data() + 12, &fields, 4);
    EXPECT_NE(announcedDescriptors(cut), 2U) << length;
  }
  for (size_t at = 16; at < call.size(); ++at) {
    for (const char byte : {'\0', '\1', '\x7F', '\xFF', 'g', 'v'}) {
      std::string changed = call;
      changed[at] = byte;
      static_cast<void>(announcedDescriptors(changed));
    }
  }
}

TEST(AnnouncedDescriptorsTest, AMessageCanBeMadeToAnnounceNone) {
  auto call = rawCall("UploadFile", "", "sh", 0, 1, 2);
  announceNoDescriptors(call);
  EXPECT_EQ(announcedDescriptors(call), 0U);
  EXPECT_EQ(headerSize(call), call.size());
  auto without = rawCall("UploadFile", "", "sh", 0, 1);
  const auto before = without;
  announceNoDescriptors(without);
  EXPECT_EQ(without, before);
}

TEST(AnnouncedDescriptorsTest, AFieldOfAnotherTypeIsNotUnderstood) {
  auto call = rawCall("UploadFile", "", "sh", 0, 1, 2);
  const size_t at = call.rfind(std::string("\x09\1u", 3));
  ASSERT_NE(at, std::string::npos);
  call[at + 2] = 'x';
  EXPECT_EQ(announcedDescriptors(call), std::nullopt);
  call[at + 2] = 's';
  EXPECT_EQ(announcedDescriptors(call), std::nullopt);
}

TEST(DescriptorPassingTest, NoMoreThanTheLimitAreReceivedAndTheRestIsClosed) {
  std::array<int, 2> ends{};
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()), 0);
  const UniqueFd sender(ends[0]);
  const UniqueFd receiver(ends[1]);
  std::vector<UniqueFd> descriptors;
  for (unsigned i = 0; i < wire::kMaxDescriptors; ++i) descriptors.emplace_back(dup(0));
  const size_t before = openDescriptors();
  EXPECT_EQ(sendWithDescriptors(sender.get(), "ab", descriptors), 2);
  EXPECT_EQ(sendWithDescriptors(sender.get(), "c", {}), 1);
  std::array<char, 16> room{};
  std::vector<UniqueFd> received;
  EXPECT_EQ(receiveWithDescriptors(receiver.get(), room.data(), room.size(), received), 2);
  EXPECT_EQ(received.size(), wire::kMaxDescriptors);
  EXPECT_EQ(openDescriptors(), before + wire::kMaxDescriptors);
  EXPECT_EQ(receiveWithDescriptors(receiver.get(), room.data(), room.size(), received), 1);
  EXPECT_EQ(received.size(), wire::kMaxDescriptors);
  EXPECT_EQ(receiveWithDescriptors(receiver.get(), room.data(), room.size(), received), -1);
  received.clear();
  EXPECT_EQ(openDescriptors(), before);
}

TEST(LastNumberTest, IsThatOfTheMessageHoweverItIsCut) {
  const std::string bytes = "abcdefgh\x01\x02\x03\x04";
  for (const auto& [order, expected] : {std::pair{'l', 0x04030201U}, std::pair{'B', 0x01020304U}}) {
    for (size_t cut = 1; cut <= bytes.size(); ++cut) {
      LastNumber number;
      number.begin(order);
      for (size_t at = 0; at < bytes.size(); at += cut) number.add(std::string_view(bytes).substr(at, cut));
      EXPECT_EQ(number.value(), expected) << cut;
      number.begin(order);
      EXPECT_EQ(number.value(), 0U);
    }
  }
}

}  // namespace
}  // namespace tarnel
