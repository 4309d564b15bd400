#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>

#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "ipc/server/ipc_test_support.h"

namespace tarnel {

// The body of UploadFile: a text, and which of the descriptors.
inline std::string uploadBody(const std::string& fileURL, uint32_t index = 0) {
  const auto size = static_cast<uint32_t>(fileURL.size());
  std::string body(reinterpret_cast<const char*>(&size), 4);
  body += fileURL + '\0';
  while (body.size() % 4 != 0) body += '\0';
  return body.append(reinterpret_cast<const char*>(&index), 4);
}

inline std::string rawUpload(const std::string& fileURL, uint32_t announced = 1, uint32_t serial = 1) {
  return rawCall("UploadFile", uploadBody(fileURL), "sh", UINT32_MAX, serial, announced);
}

// Clients that hand over files, and what every upload does with them.
class IpcFilesTest : public ::testing::Test {
 protected:
  std::string write(const std::string& name, const std::string& text) const {
    std::string path = service.folder().path() + '/' + name;
    std::ofstream(path) << text;
    return path;
  }
  static UniqueFd open(const std::string& path, int flags = O_RDONLY) {
    UniqueFd file(::open(path.c_str(), flags | O_CLOEXEC));
    EXPECT_TRUE(file) << path;
    return file;
  }
  // What every upload does with its file.
  void onFile(std::function<void(ClientFile&)> use) { service.startOnFiles(std::move(use)); }
  std::optional<bool> upload(BusClient& client, const std::string& path, const UniqueFd& file) {
    const auto reply = client.call("UploadFile", "sh", path.c_str(), file.get());
    int success = -1;
    if (reply == nullptr || sd_bus_message_read(reply.get(), "b", &success) <= 0) return std::nullopt;
    return success == 1;
  }
  // The texts of all calls of the client's object that have come.
  static std::vector<std::string> deletions(BusClient& client) {
    std::vector<std::string> texts;
    sd_bus_message* message = nullptr;
    while (sd_bus_process(client.bus(), &message) > 0) {
      const BusMessage held(message);
      const char* text = nullptr;
      if (message == nullptr ||
          sd_bus_message_is_method_call(message, wire::kReplyInterface, wire::kDeleteFile.name) <= 0) {
        continue;
      }
      EXPECT_STREQ(sd_bus_message_get_path(message), wire::kReplyPath);
      EXPECT_EQ(sd_bus_message_get_expect_reply(message), 0);
      EXPECT_GE(sd_bus_message_read(message, "s", &text), 0);
      texts.emplace_back(text);
    }
    return texts;
  }
  std::string refusal(const std::string& token) {
    EXPECT_EQ(service.clientFiles().consume(token), nullptr);
    return service.log().lines().back().text;
  }

  Service service;
};

}  // namespace tarnel
