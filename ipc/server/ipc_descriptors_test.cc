#include "ipc/server/ipc_files_test_fixture.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <array>
#include <vector>

// The descriptors that come with messages, as bytes on the socket.

namespace tarnel {
namespace {

using ::testing::ElementsAre;

TEST_F(IpcFilesTest, DescriptorsFindTheirMessagesHoweverTheBytesAreCut) {
  std::vector<std::string> contents;
  onFile([&contents](ClientFile& file) { contents.push_back(*file.contents()); });
  const auto one = open(write("1", "one"));
  const auto two = open(write("2", "two"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  // Behind other messages, in one piece.
  EXPECT_TRUE(client.writeWith(rawCall("StartConfig") + rawUpload("/1") + rawCall("StartConfig"), one.get()));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 3; }));
  // Byte by byte.
  const auto call = rawUpload("/2");
  EXPECT_TRUE(client.writeWith(call.substr(0, 1), two.get()));
  for (const char byte : call.substr(1)) EXPECT_TRUE(client.write({&byte, 1}));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 4; }));
  // For two messages at once.
  EXPECT_TRUE(client.writeWith(rawUpload("/1") + rawUpload("/1", 1, 2), one.get(), 2));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 6; }));
  service.stop();
  EXPECT_THAT(contents, ElementsAre("one", "two", "one", "one"));
}

TEST_F(IpcFilesTest, ADescriptorThatIsAnnouncedAndMissingEndsTheConnection) {
  onFile([](ClientFile&) {});
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  EXPECT_TRUE(client.write(rawUpload("/x")));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
  const RawClient few(service.path());
  few.authenticateForDescriptors();
  EXPECT_TRUE(few.writeWith(rawUpload("/x", 5), 0, 5));
  EXPECT_TRUE(isClosedByPeer(few.fd()));
  EXPECT_TRUE(service.logged("a message announces 5 descriptors, and 4 came; at most 4 may"));
  EXPECT_EQ(service.session(0), nullptr);
}

TEST_F(IpcFilesTest, ACallWithoutItsDescriptorIsRefused) {
  onFile([](ClientFile&) {});
  BusClient client(service.path());
  auto call = client.newCall("UploadFile");
  EXPECT_GE(sd_bus_message_append(call.get(), "s", "/x"), 0);
  EXPECT_EQ(client.call(call), nullptr);
  EXPECT_EQ(client.errorText, "UploadFile takes the arguments \"sh\", not \"s\"");
  const RawClient raw(service.path());
  raw.authenticateForDescriptors();
  EXPECT_TRUE(raw.write(rawCall("UploadFile", uploadBody("/x"), "sh")));
  EXPECT_TRUE(raw.writeWith(rawUpload("/x", 2), 0, 2));
  EXPECT_TRUE(raw.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 2 && service.session(1)->count() == 1; }));
  EXPECT_THAT(service.session(1)->calls(), ElementsAre("startConfig"));
}

TEST_F(IpcFilesTest, TheDescriptorIsNamedByTheOnlyIndexThereIs) {
  onFile([](ClientFile&) {});
  const auto file = open(write("x", "x"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  const auto upload = [](uint32_t index) {
    return rawCall("UploadFile", uploadBody("/x", index), "sh", UINT32_MAX, 1, 1);
  };
  EXPECT_TRUE(client.writeWith(upload(1), file.get()));
  // Also when the index comes in pieces.
  const std::string call = upload(0x01000000);
  EXPECT_TRUE(client.writeWith(call.substr(0, call.size() - 2), file.get()));
  std::string answers;
  std::array<char, 4096> piece{};
  const auto readUntil = [&](const std::string& text) {
    while (answers.find(text) == std::string::npos) {
      const auto got = recv(client.fd().get(), piece.data(), piece.size(), 0);
      if (got <= 0) return false;
      answers.append(piece.data(), static_cast<size_t>(got));
    }
    return true;
  };
  EXPECT_TRUE(
      readUntil("UploadFile names the descriptor by the index 1; one came with the message, and its "
                "index is 0"))
      << answers;
  EXPECT_TRUE(client.write(call.substr(call.size() - 2, 1)));
  EXPECT_TRUE(client.write(call.substr(call.size() - 1)));
  EXPECT_TRUE(readUntil("by the index 16777216;")) << answers;
  EXPECT_EQ(service.session()->count(), 0U);
  EXPECT_TRUE(client.writeWith(upload(0), file.get()));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 1; }));
}

// The bus library would leave it open, with nobody to close it.
TEST_F(IpcFilesTest, TheDescriptorOfAMalformedMessageIsClosed) {
  onFile([](ClientFile&) {});
  const auto file = open(write("x", "x"));
  auto call = rawUpload("/x");
  const size_t path = call.find("/com/orvane");
  ASSERT_NE(path, std::string::npos);
  call[path] = '!';
  const size_t before = openDescriptors();
  for (int i = 0; i < 20; ++i) {
    const RawClient client(service.path());
    client.authenticateForDescriptors();
    EXPECT_TRUE(client.writeWith(call, file.get()));
    EXPECT_TRUE(isClosedByPeer(client.fd()));
  }
  EXPECT_TRUE(eventually([&] { return service.invalidations() == 20; }));
  EXPECT_TRUE(eventually([before] { return openDescriptors() <= before; }));
}

TEST_F(IpcFilesTest, WithoutNegotiationNoDescriptorIsTaken) {
  onFile([](ClientFile&) {});
  const RawClient client(service.path());
  client.authenticate();
  EXPECT_TRUE(client.writeWith(rawUpload("/x"), 0));
  EXPECT_TRUE(isClosedByPeer(client.fd()));
}

// A call whose answer takes its time must not keep descriptors open meanwhile.
TEST_F(IpcFilesTest, NoOtherCallTakesDescriptors) {
  std::vector<SentReply> held;
  service.prepare = [&held](RecordingSession& session) {
    session.answerSend = [&held](SentReply reply) { held.push_back(std::move(reply)); };
  };
  service.start();
  const auto file = open(write("x", "x"));
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 1; }));
  const size_t before = openDescriptors();
  const std::string body = std::string("\1\0\2\0\0\0\0\0", 8);
  for (uint32_t i = 0; i < 50; ++i) {
    EXPECT_TRUE(
        client.writeWith(rawCall("SendMessage", body, "qqaa{sv}", UINT32_MAX, i + 1, 4), file.get(), 4));
    EXPECT_TRUE(client.writeWith(rawCall("FinishSession", "", "", UINT32_MAX, i + 1, 1), file.get()));
  }
  EXPECT_TRUE(client.write(rawCall("StartConfig")));
  EXPECT_TRUE(eventually([&] { return service.session()->count() == 2; }));
  EXPECT_EQ(openDescriptors(), before);
  service.stop();
  EXPECT_THAT(held, ::testing::IsEmpty());
}

TEST_F(IpcFilesTest, DescriptorsThatNoMessageAnnouncesAreToldOnce) {
  service.start();
  const RawClient client(service.path());
  client.authenticateForDescriptors();
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(client.writeWith(rawCall("StartConfig"), 0, 3));
  EXPECT_TRUE(eventually([&] { return service.accepted() == 1 && service.session()->count() == 3; }));
  service.stop();
  size_t lines = 0;
  for (const auto& line : service.log().lines()) {
    if (line.text.find("that no message announces are closed") != std::string::npos) ++lines;
  }
  EXPECT_EQ(lines, 1U);
}

}  // namespace
}  // namespace tarnel
