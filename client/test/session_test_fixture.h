#pragma once

#include <gtest/gtest.h>

#include <chrono>

#include "client/test/test_daemon.h"
#include "tarnel/tarnel.h"

namespace tarnel::client {

// Longer than anything may take.
constexpr std::chrono::seconds kLong{30};

// Sessions of the C++ interface, and under it the C interface and everything else, against a stand-in daemon.
class SessionTest : public ::testing::Test {
 protected:
  Options options() const {
    Options options;
    options.socketPath = folder_.file("socket");
    return options;
  }

  // From when this returns: the stand-in's thread has gone round once, and sees the flag before it waits
  // again.
  void stopAccepting() {
    daemon_.stopsAccepting = true;
    daemon_.callClients({}, 0, 0, 0, {});
  }

  test::ScratchFolder folder_;
  test::TestDaemon daemon_{folder_.file("socket")};
};

}  // namespace tarnel::client
