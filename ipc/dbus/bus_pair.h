#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <systemd/sd-bus.h>

#include <array>
#include <functional>
#include <memory>

// For tests: two sd-bus objects that talk over a socket pair, and messages that have crossed it.

namespace tarnel::wire {

struct UnrefMessage {
  void operator()(sd_bus_message* message) const { sd_bus_message_unref(message); }
};
using MessagePtr = std::unique_ptr<sd_bus_message, UnrefMessage>;

class BusPair {
 public:
  BusPair() {
    std::array<int, 2> ends{};
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, ends.data()), 0);
    sd_id128_t id{};
    EXPECT_EQ(sd_id128_randomize(&id), 0);
    for (size_t i = 0; i < 2; ++i) {
      sd_bus* bus = nullptr;
      EXPECT_GE(sd_bus_new(&bus), 0);
      buses_[i].reset(bus);
      EXPECT_GE(sd_bus_set_fd(bus, ends[i], ends[i]), 0);
      EXPECT_GE(sd_bus_negotiate_fds(bus, 1), 0);
    }
    EXPECT_GE(sd_bus_set_server(buses_[1].get(), 1, id), 0);
    EXPECT_GE(sd_bus_set_anonymous(buses_[1].get(), 1), 0);
    for (auto& bus : buses_) EXPECT_GE(sd_bus_start(bus.get()), 0);
    while (sd_bus_is_ready(buses_[0].get()) <= 0 || sd_bus_is_ready(buses_[1].get()) <= 0) {
      for (auto& bus : buses_) EXPECT_GE(sd_bus_process(bus.get(), nullptr), 0);
    }
  }

  // A signal, which any bus lets through, for the writer to fill.
  MessagePtr newMessage() {
    sd_bus_message* message = nullptr;
    EXPECT_GE(sd_bus_message_new_signal(buses_[0].get(), &message, "/t", "t.T", "T"), 0);
    return MessagePtr(message);
  }

  // What the other end received.
  MessagePtr crossed(const MessagePtr& message) {
    EXPECT_GE(sd_bus_send(buses_[0].get(), message.get(), nullptr), 0);
    for (int i = 0; i < 1000; ++i) {
      EXPECT_GE(sd_bus_process(buses_[0].get(), nullptr), 0);
      sd_bus_message* received = nullptr;
      EXPECT_GE(sd_bus_process(buses_[1].get(), &received), 0);
      if (received != nullptr) return MessagePtr(received);
    }
    ADD_FAILURE() << "the message did not arrive";
    return nullptr;
  }

 private:
  struct Close {
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
  };
  std::array<std::unique_ptr<sd_bus, Close>, 2> buses_;
};

}  // namespace tarnel::wire
