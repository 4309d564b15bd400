#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <vector>

#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "platform/fake/lock_probe.h"
#include "session/fake_backends.h"
#include "session/tarneld_session.h"
#include "tarnel/keys.h"

namespace tarnel::fake {

// An agent that answers what the test says and writes down what it is asked.
class FakeDelegate final : public TarneldSessionDelegate {
 public:
  explicit FakeDelegate(Journal& journal) : journal_(journal) {}

  std::optional<Dictionary> storebagForSession(TarneldSession& /*session*/) override {
    journal_.add("storebagForSession");
    if (throws) throw InvalidArgument("client type 2 has no storebag");
    return storebag;
  }
  MaybeString storebagVersionForSession(TarneldSession& /*session*/) override {
    journal_.add("storebagVersionForSession");
    return version;
  }
  MaybeString parentSessionIDStringForSession(TarneldSession& /*session*/) override { return parentID; }
  void userInfoUpdatedForSession(TarneldSession& /*session*/) override {
    journal_.add("userInfoUpdatedForSession");
  }
  std::shared_ptr<TarneldSession> getAncestorWithAggregatorForSession(TarneldSession& /*session*/) override {
    ++ancestorLookups;
    isAncestorAskedLocked = isLocked();
    return ancestor;
  }
  void updateDownstreamSessions(TarneldSession& session) override {
    journal_.add("updateDownstreamSessions");
    session.updateCombinedSessionID();
    session.syncReportingStates();
  }
  std::shared_ptr<TarneldSession> parentSessionForChild(TarneldSession& /*child*/) override {
    isParentAskedLocked = isLocked();
    return parent;
  }
  AgentLock& agentLock() override { return lock_; }
  std::string description() const override { return "<delegate>"; }

  std::optional<Dictionary> storebag;
  MaybeString version;
  MaybeString parentID;
  std::shared_ptr<TarneldSession> ancestor;
  std::shared_ptr<TarneldSession> parent;
  bool throws = false;
  int ancestorLookups = 0;
  // Whether the lock was held at the last question of that kind.
  bool isAncestorAskedLocked = false;
  bool isParentAskedLocked = false;
  bool isLocked() { return !isFree(lock_); }

 private:
  Journal& journal_;
  AgentLock lock_;
};

// One session with a fake agent, fake backends and a fake connection.
class SessionTest : public ::testing::Test {
 protected:
  using Lines = std::vector<std::string>;

  // A connection whose client can be called.
  static std::shared_ptr<FakeIpcConnection> newConnection() {
    auto made = std::make_shared<FakeIpcConnection>();
    made->setRemoteObjectInterface();
    return made;
  }
  std::shared_ptr<TarneldSession> newSession(const std::shared_ptr<FakeIpcConnection>& to) {
    return TarneldSession::initWithSessionDelegate(world.dependencies, delegate, to, backends.factory());
  }
  static Dictionary info(int64_t number = 7, bool requireUserInfo = true) {
    return {{kTarnelSessionInfoSessionID, number},
            {kTarnelSessionInfoClientType, 8},
            {kTarnelSessionInfoRequireUserInfo, requireUserInfo}};
  }
  static Dictionary user(const std::string& client = "Phone", const std::string& service = "Call") {
    return {{kTarnelUserInfoClientName, client}, {kTarnelUserInfoServiceName, service}};
  }
  // Makes a backend for each name and gives the session a storebag that lists them.
  void offer(const std::vector<std::string>& names) {
    for (const auto& name : names) backends.scripts.try_emplace(name);
    delegate->storebag = sectionOf(names);
    delegate->version = "5.1";
  }
  void configureAndStart(bool hasAggregator = false) {
    session->setSessionInfo(info(), user(), std::nullopt, hasAggregator);
    session->startConfigWithCompletionHandler(nullptr);
    backends.journal.clear();
    world.log.clear();
  }
  // Everything in the message log, without the dates.
  Lines messageLog() const {
    Lines lines;
    for (const auto& [path, file] : world.files.files) {
      size_t from = 0;
      for (size_t to = file.text.find('\n'); to != std::string::npos; to = file.text.find('\n', from)) {
        const std::string line = file.text.substr(from, to - from);
        lines.push_back(line.substr(line.find(") ") + 2));
        from = to + 1;
      }
    }
    return lines;
  }
  bool logged(LogLevel level, const std::string& text) const { return world.log.contains(level, text); }

  FakeWorld world;
  FakeBackends backends;
  std::shared_ptr<FakeDelegate> delegate = std::make_shared<FakeDelegate>(backends.journal);
  std::shared_ptr<FakeIpcConnection> connection = newConnection();
  std::shared_ptr<TarneldSession> session = newSession(connection);
};

}  // namespace tarnel::fake
