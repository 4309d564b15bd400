#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backends/https/https_post_backend.h"
#include "formats/document.h"
#include "platform/fake/fake_world.h"
#include "tarnel/keys.h"

namespace tarnel {

inline std::string inflated(const std::string& gzip) {
  z_stream stream{};
  inflateInit2(&stream, 31);
  std::string input = gzip;
  std::string out(8U << 20U, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(input.data());
  stream.avail_in = static_cast<uInt>(input.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int result = inflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  inflateEnd(&stream);
  return result == Z_STREAM_END ? out : "not gzip";
}

inline const std::string* headerOf(const HttpRequest& request, std::string_view name) {
  for (const auto& header : request.headers) {
    if (header.name == name) return &header.value;
  }
  return nullptr;
}

// The JSON text that a request carries.
inline std::string bodyText(const HttpRequest& request) {
  if (request.body == nullptr) return {};
  return headerOf(request, "Content-Encoding") == nullptr ? *request.body : inflated(*request.body);
}

inline Dictionary parsed(const std::string& json) {
  const auto document = parseDocument(json);
  if (!document || document->dictionary() == nullptr) {
    ADD_FAILURE() << "not a JSON object: " << json;
    return {};
  }
  return *document->dictionary();
}

// A world in which one client entry decides: a client that reports fully and batches.
class HTTPSPostBackendFixture : public ::testing::Test {
 protected:
  static constexpr char kWarning[] = "HTTPSPostBackend(updateBackendState): httppost: ";

  HTTPSPostBackendFixture() {
    entry = Dictionary{{"client", "Meetwell"},
                       {"service", "video"},
                       {"locale_whitelist", Array{"DE", "FR"}},
                       {"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}}}},
                       {"sampling_threshold", 1},
                       {"event_threshold", 49},
                       {"post_url", "https://events.example/post"},
                       {"realtime_post_url", "https://events.example/realtime"}};
    userInfo =
        Dictionary{{kTarnelUserInfoClientName, "Meetwell"}, {kTarnelUserInfoServiceName, "video-call"}};
    world.clock.set({1700000100, 500000});
  }

  Dictionary profile() const {
    Dictionary result{{"display_url", "https://show.example"}};
    result.set("clients", clients.empty() ? Array{Value(entry)} : clients);
    return result;
  }

  // Set up as a session does, before the first updateState.
  std::shared_ptr<HTTPSPostBackend> make() {
    auto made = HTTPSPostBackend::initWithName(world.dependencies, "httppost", profile(), "Slate");
    EXPECT_NE(made, nullptr);
    made->setSessionID(77);
    made->setCompType(12);
    made->setClientVersion(5);
    made->setUdid("device-id");
    made->setProductVersion("12.5");
    made->setBuildVersion("24A100");
    made->setHardwareType("Slate7,1");
    made->setIsInternal(internal);
    made->setRequireUserInfo(requireUserInfo);
    made->setBatchEvents(batch);
    made->setUserInfoDict(userInfo);
    made->setSelfVersion("3.2");
    made->setStartTimestamp({1700000045, 250000});
    return made;
  }
  // ... and after it.
  std::shared_ptr<HTTPSPostBackend> makeUpdated() {
    auto made = make();
    made->updateState();
    return made;
  }

  static MaybeSentObject send(TarnelBackend& backend, int method = 3, Flag flag = Flag::normal,
                              const MaybeDictionary& payload = Dictionary{{"a", 1}}, int respCode = 8) {
    return backend.sendMessage(payload, TimeValue{1700000060, 750000}, Method{static_cast<uint16_t>(method)},
                               RespCode{static_cast<uint16_t>(respCode)}, flag);
  }
  // Flushes and gives what the completion was told; fails unless it was told once.
  static std::pair<MaybeString, MaybeError> flush(TarnelBackend& backend) {
    int answers = 0;
    std::pair<MaybeString, MaybeError> told;
    backend.flushMessagesWithCompletion([&](MaybeString text, MaybeError error) {
      ++answers;
      told = {std::move(text), std::move(error)};
    });
    EXPECT_EQ(answers, 1);
    return told;
  }

  // Messages that were posted, and their events.
  std::vector<Dictionary> messages() const {
    std::vector<Dictionary> all;
    for (const auto& request : world.http.requests()) all.push_back(parsed(bodyText(request)));
    return all;
  }
  static std::vector<Dictionary> eventsOf(const Dictionary& message) {
    std::vector<Dictionary> events;
    const auto* array = findArray(message, "events");
    if (array == nullptr) return events;
    for (const auto& event : *array) events.push_back(*event.dictionary());
    return events;
  }
  std::vector<Dictionary> postedEvents() const {
    std::vector<Dictionary> all;
    for (const auto& message : messages()) {
      for (auto& event : eventsOf(message)) all.push_back(std::move(event));
    }
    return all;
  }
  static std::vector<std::string> namesOf(const Dictionary& dictionary) {
    std::vector<std::string> names;
    for (const auto& [name, value] : dictionary) names.push_back(name);
    return names;
  }
  void expectLog(LogLevel level, const std::string& text) const {
    std::string all;
    for (const auto& line : world.log.lines()) all += line.text + "\n";
    EXPECT_TRUE(world.log.contains(level, text)) << text << "\nis not among:\n" << all;
  }

  fake::FakeWorld world;
  Dictionary entry;
  Array clients;  // empty: just the entry
  MaybeDictionary userInfo;
  bool requireUserInfo = true;
  bool batch = true;
  bool internal = false;
};

}  // namespace tarnel
