#pragma once

#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "session/backend_set.h"

namespace tarnel::fake {

// What happened, in order, across all fakes of one test. Threads: any.
class Journal {
 public:
  void add(std::string line) {
    const std::lock_guard guard(mutex_);
    lines_.push_back(std::move(line));
  }
  std::vector<std::string> lines() const {
    const std::lock_guard guard(mutex_);
    return lines_;
  }
  void clear() {
    const std::lock_guard guard(mutex_);
    lines_.clear();
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

// How the backends of one name behave.
struct BackendScript {
  ReportingState decides = ReportingState::enabled;
  int32_t hierarchy = 0;
  std::optional<Value> threshold;
  MaybeString displayURL;
  MaybeSentObject sends;
  MaybeString flushText;
  MaybeError flushError;
  bool holdFlush = false;
  bool uploads = false;
  // Each throws after it was noted in the journal, a flush before or after it has answered.
  bool sendThrows = false;
  bool flushThrows = false;
  bool flushThrowsAfterwards = false;
  bool uploadThrows = false;
  bool updateStateThrows = false;
  bool correlatedSessionIDThrows = false;
  bool cleanupThrows = false;
  bool cleanupThrowsNumber = false;
  bool setUpThrows = false;
};

// Keeps what it is given. Like a real one it takes no lock.
class FakeBackend final : public TarnelBackend {
 public:
  struct Sent {
    MaybeDictionary payload;
    TimeValue timestamp;
    Method method;
    RespCode respCode;
    EventID eventID;
    Flag flag;
    MaybeString sessionID;  // the label that the event would carry
  };

  FakeBackend(const Dependencies& dependencies, const std::string& name, const Value& profile,
              const MaybeString& productFamily, int32_t clientType, const BackendScript& script,
              Journal& journal)
      : TarnelBackend(dependencies, name,
                      profile.dictionary() != nullptr ? MaybeDictionary(*profile.dictionary()) : std::nullopt,
                      productFamily),
        profileValue(profile),
        factoryClientType(clientType),
        script_(script),
        journal_(journal) {
    setDisplayURL(script.displayURL);
  }

  void cleanup() override {
    journal_.add(name() + " cleanup");
    if (script_.cleanupThrows) throw std::runtime_error("cleanup went wrong");
    if (script_.cleanupThrowsNumber) throw 5;
  }
  void updateState() override {
    journal_.add(name() + " updateState");
    if (script_.updateStateThrows) throw std::runtime_error("update went wrong");
    setHierarchy(script_.hierarchy);
    setSamplingThreshold(script_.threshold);
    setState(script_.decides);
  }
  void setUserInfoDict(const MaybeDictionary& userInfo) override {
    journal_.add(name() + " setUserInfoDict");
    if (script_.setUpThrows) throw std::runtime_error("set-up went wrong");
    TarnelBackend::setUserInfoDict(userInfo);
  }
  void setCorrelatedSessionID(const MaybeString& correlatedSessionID) override {
    journal_.add(name() + " setCorrelatedSessionID");
    if (script_.correlatedSessionIDThrows) throw std::runtime_error("label went wrong");
    TarnelBackend::setCorrelatedSessionID(correlatedSessionID);
    for (Sent& event : sent) event.sessionID = correlatedSessionID;
  }
  MaybeSentObject sendMessage(const MaybeDictionary& payload, const TimeValue& timestamp, Method method,
                              RespCode respCode, EventID eventID, Flag flag) override {
    journal_.add(name() + " send " + std::to_string(static_cast<int>(method)) + "/" +
                 std::to_string(static_cast<int>(respCode)));
    if (script_.sendThrows) throw std::runtime_error("send went wrong");
    sent.push_back({payload, timestamp, method, respCode, eventID, flag, combinedSessionIDString()});
    return script_.sends;
  }
  MaybeString flushMessagesWithCompletion(FlushCompletion completion) override {
    journal_.add(name() + " flush");
    if (script_.flushThrows) throw std::runtime_error("flush went wrong");
    if (script_.holdFlush) {
      heldFlushes.push_back(std::move(completion));
    } else {
      completion(script_.flushText, script_.flushError);
    }
    if (script_.flushThrowsAfterwards) throw std::runtime_error("flush went wrong");
    return script_.flushText;
  }
  bool uploadFileAtPath(const std::string& path, const std::string& extensionToken) override {
    journal_.add(name() + " upload " + path + " with " + extensionToken);
    if (script_.uploadThrows) throw std::runtime_error("upload went wrong");
    return script_.uploads;
  }
  bool uploadLogData(const Array& logData) override {
    journal_.add(name() + " uploadLogData of " + std::to_string(logData.size()));
    if (script_.uploadThrows) throw std::runtime_error("upload went wrong");
    return script_.uploads;
  }

  double startTime() const { return startTimeStamp(); }
  std::pair<int, int> selfVersion() const { return {selfVersionMajor(), selfVersionMinor()}; }

  const Value profileValue;
  const int32_t factoryClientType;
  std::vector<Sent> sent;
  std::deque<FlushCompletion> heldFlushes;

 private:
  const BackendScript& script_;
  Journal& journal_;
};

// A factory of fake backends: one for each name that has a script. Set up before threads start.
class FakeBackends {
 public:
  Journal journal;
  std::map<std::string, BackendScript> scripts;

  BackendFactory factory() {
    return [this](const Dependencies& dependencies, const std::string& name, const Value& profile,
                  const MaybeString& productFamily, int32_t clientType) -> std::shared_ptr<TarnelBackend> {
      const auto script = scripts.find(name);
      if (script == scripts.end()) return nullptr;
      auto backend = std::make_shared<FakeBackend>(dependencies, name, profile, productFamily, clientType,
                                                   script->second, journal);
      const std::lock_guard guard(mutex_);
      made_.push_back(backend);
      return backend;
    };
  }
  // The newest of that name; null when none was made.
  std::shared_ptr<FakeBackend> last(const std::string& name) const {
    const std::lock_guard guard(mutex_);
    for (auto made = made_.rbegin(); made != made_.rend(); ++made) {
      if ((*made)->name() == name) return *made;
    }
    return nullptr;
  }
  // Every one, in the order in which they were made.
  std::vector<std::shared_ptr<FakeBackend>> made() const {
    const std::lock_guard guard(mutex_);
    return made_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<FakeBackend>> made_;
};

// A storebag section with an empty profile under each name.
inline Dictionary sectionOf(const std::vector<std::string>& names) {
  Dictionary section;
  for (const auto& name : names) section.set(name, Dictionary());
  return section;
}

}  // namespace tarnel::fake
