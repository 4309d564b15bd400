#pragma once

#include <gtest/gtest.h>

#include "ipc/dbus/bus_pair.h"
#include "ipc/dbus/dbus_codec.h"
#include "ipc/protocol/wire.h"

// Values and messages that have crossed a connection.

namespace tarnel::wire {

class DbusCodecTest : public ::testing::Test {
 protected:
  template <class Append>
  MessagePtr send(Append append) {
    auto message = buses_.newMessage();
    const MaybeError error = append(message.get());
    EXPECT_FALSE(error) << error->description();
    return buses_.crossed(message);
  }

  // A message written by hand, as another program's library would.
  template <class Build>
  MessagePtr sendRaw(Build build) {
    auto message = buses_.newMessage();
    build(message.get());
    return buses_.crossed(message);
  }

  Dictionary roundTrip(const Dictionary& dictionary) {
    const auto message = send([&](sd_bus_message* m) { return appendDictionary(m, dictionary); });
    auto read = readDictionary(message.get());
    EXPECT_TRUE(read) << read.error().description();
    return read ? std::move(*read) : Dictionary();
  }

  // The value that a hand-written variant is read as.
  template <class... Arguments>
  Value valueOf(const char* signature, Arguments... arguments) {
    const auto message = sendRaw([&](sd_bus_message* m) {
      ASSERT_GE(sd_bus_message_append(m, "a{sv}", 1, "k", signature, arguments...), 0);
    });
    const auto read = readDictionary(message.get());
    EXPECT_TRUE(read) << read.error().description();
    const auto* value = read ? read->find("k") : nullptr;
    return value == nullptr ? Value() : *value;
  }

  template <class... Arguments>
  Error refusalOf(const char* signature, Arguments... arguments) {
    const auto message =
        sendRaw([&](sd_bus_message* m) { ASSERT_GE(sd_bus_message_append(m, signature, arguments...), 0); });
    const auto read = readDictionary(message.get());
    EXPECT_FALSE(read);
    return read ? Error("", 0, "") : read.error();
  }

  BusPair buses_;
};

}  // namespace tarnel::wire
