#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "daemon/tarneld_agent.h"
#include "platform/fake/fake_ipc.h"
#include "platform/fake/fake_world.h"
#include "tests/fuzz/fuzz_target.h"

// The real agent, real sessions and real backends in a world of fakes.

namespace tarnel::fuzz {

// Keeps count of what callers are owed.
class ReplyLedger {
 public:
  // A reply that must be called at most once, and that tells when it is let go of.
  template <class... Args>
  OneShot<void(Args...)> owe() {
    ++owed_;
    return [entry = std::make_unique<Entry>(*this)](Args...) { entry->answer(); };
  }
  // As owe(); `inner` is called with what the answer was.
  template <class... Args>
  OneShot<void(Args...)> watch(OneShot<void(Args...)> inner) {
    if (!inner) return nullptr;
    ++owed_;
    return [entry = std::make_unique<Entry>(*this), held = std::move(inner)](Args... args) mutable {
      entry->answer();
      held(std::move(args)...);
    };
  }

  size_t answered() const noexcept { return answered_; }
  size_t dropped() const noexcept { return dropped_; }
  // Neither answered nor let go of.
  size_t pending() const noexcept { return owed_ - answered_ - dropped_; }

 private:
  class Entry {
   public:
    explicit Entry(ReplyLedger& ledger) : ledger_(ledger) {}
    Entry(const Entry&) = delete;
    Entry& operator=(const Entry&) = delete;
    ~Entry() {
      if (!isAnswered_) ++ledger_.dropped_;
    }
    void answer() {
      require(!std::exchange(isAnswered_, true), "a reply is called once");
      ++ledger_.answered_;
    }

   private:
    ReplyLedger& ledger_;
    bool isAnswered_ = false;
  };

  size_t owed_ = 0;
  size_t answered_ = 0;
  size_t dropped_ = 0;
};

class SessionWorld {
 public:
  SessionWorld();
  ~SessionWorld();
  SessionWorld(const SessionWorld&) = delete;
  SessionWorld& operator=(const SessionWorld&) = delete;

  std::shared_ptr<fake::FakeIpcConnection> connect();

  // A clock that moves, a server's answer, a new storebag, a tick: what happens between two calls.
  void happen(InputReader& input);
  // Puts a file where an upload will look for it.
  void offerFile(const std::string& token, std::string contents, bool isRegular);
  // Uploads wait for their answer on the calling thread, which is the only one.
  void answerAtOnce() { fakes.http.holdAnswers(false); }
  // Answers what still waits, and lets time pass until nothing is under way. Afterwards nothing may be left
  // of sessions that are gone.
  void settle();
  // That what was posted so far is what may be posted.
  void examinePosts();

  static std::vector<std::string_view> words();

  fake::FakeWorld fakes;
  ReplyLedger replies;
  std::optional<Dictionary> storebag;  // what a fetch gives
  std::shared_ptr<TarneldAgent> agent;

 private:
  class NoListener final : public IpcListener {
   public:
    void setDelegate(IpcListenerDelegate* /*delegate*/) override {}
    MaybeError resume() override { return std::nullopt; }
  };

  void answer(InputReader& input);
  void changeStorebag(InputReader& input);

  NoListener listener_;
};

// A section that names every backend; two of its clients report, on two levels of the hierarchy.
Dictionary fullStorebag();

}  // namespace tarnel::fuzz
