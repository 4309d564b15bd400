#pragma once

#include <gtest/gtest.h>

#include <string>
#include <utility>
#include <vector>

#include "tarnel/keys.h"
#include "tarnel/tarnel.h"
#include "testing/private_instance.h"
#include "testing/waiting.h"

// Clients of the daemon, through the client library.

namespace tarnel::test {

struct SessionSetup {
  int clientType = 8;
  uint32_t sessionID = 7;
  bool requireUserInfo = true;
  bool batch = false;
  std::string client = "Meetwell";  // both empty: no user info
  std::string service = "video-call";
};

inline client::Dictionary sessionInfo(const SessionSetup& setup) {
  client::Dictionary info;
  info.set(kTarnelSessionInfoSessionID, setup.sessionID)
      .set(kTarnelSessionInfoClientType, setup.clientType)
      .set(kTarnelSessionInfoClientVersion, 3)
      .set(kTarnelSessionInfoRequireUserInfo, setup.requireUserInfo)
      .set(kTarnelSessionInfoBatchEvent, setup.batch);
  return info;
}

inline client::Dictionary userInfo(const std::string& client, const std::string& service) {
  client::Dictionary info;
  info.set(kTarnelUserInfoClientName, client).set(kTarnelUserInfoServiceName, service);
  return info;
}

// Its destruction waits until the daemon has read everything.
inline client::Options optionsFor(const PrivateInstance& instance) {
  client::Options options;
  options.socketPath = instance.socketPath();
  options.linger = kDeadline;
  return options;
}

// A session that was configured, and what starting it answered.
struct TestSession {
  TestSession(const PrivateInstance& instance, const SessionSetup& setup)
      : TestSession(optionsFor(instance), setup) {}
  TestSession(client::Options options, const SessionSetup& setup) : session(std::move(options)) {
    const auto user = userInfo(setup.client, setup.service);
    const bool named = !setup.client.empty() || !setup.service.empty();
    EXPECT_TRUE(session.setSessionInfo(sessionInfo(setup), named ? user.view() : client::DictionaryView()));
    started = session.startConfigAndWait(kDeadline);
  }

  // Names of the live backends; expects that there was a configuration.
  std::vector<std::string> backends() const {
    EXPECT_TRUE(started.ok()) << started.status.message;
    EXPECT_TRUE(started.names) << "no storebag was available";
    return started.names.value_or(std::vector<std::string>());
  }
  client::Reply send(uint16_t category, uint16_t type, client::DictionaryView payload = {},
                     client::Flag flag = client::Flag::normal) {
    return session.sendMessageAndWait(category, type, payload, flag, kDeadline);
  }

  client::Session session;
  client::Reply started;
};

}  // namespace tarnel::test
