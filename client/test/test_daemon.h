#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <list>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "base/unique_fd.h"
#include "base/value.h"

struct sd_bus;
struct sd_bus_message;

namespace tarnel::test {

// A private folder that goes with its contents.
class ScratchFolder {
 public:
  ScratchFolder();
  ~ScratchFolder();
  ScratchFolder(const ScratchFolder&) = delete;
  ScratchFolder& operator=(const ScratchFolder&) = delete;
  std::string file(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

// What the stand-in daemon received.
struct Received {
  std::string member;
  bool wantsReply = false;
  size_t together = 1;  // messages in the same call
  MaybeDictionary sessionInfo;
  MaybeDictionary userInfo;
  std::optional<Array> array;
  bool hasAggregation = false;
  uint16_t category = 0;
  uint16_t type = 0;
  uint32_t flag = 0;
  MaybeDictionary payload;
};

// A stand-in for the daemon on a real socket, which records what it is told, and misbehaves on request. A
// message is answered with the text "sent <category>/<type>", but with an error for type 13 and with
// nothing for type 14.
//
// Threads: any, once made.
class TestDaemon {
 public:
  explicit TestDaemon(std::string path);
  ~TestDaemon();
  TestDaemon(const TestDaemon&) = delete;
  TestDaemon& operator=(const TestDaemon&) = delete;

  // Misbehaviour; from now on, for what comes.
  std::atomic<bool> closesAtOnce{false};     // new connections
  std::atomic<bool> isSilent{false};         // answers nothing
  std::atomic<bool> saysNoReply{false};      // answers that no answer comes
  std::atomic<bool> refuses{false};          // answers with an error
  std::atomic<bool> answersNonsense{false};  // answers with a wrong signature
  std::atomic<bool> stopsReading{false};
  std::atomic<bool> stopsAccepting{false};

  // Loses every connection, as a daemon does that dies.
  void dropConnections();
  // Also stops listening, and removes the socket.
  void die();
  // Lets the clients aggregate.
  void callClients(const MaybeDictionary& messageInfo, double timestamp, uint16_t category, uint16_t type,
                   const MaybeDictionary& payload);
  // Asks the clients to delete a file, whether or not they handed it over.
  void askToDelete(const std::string& fileURL);
  // Ends a wait inside the daemon's thread, after a flag above was changed back.
  void nudge();

  // Waits until as many calls (messages of a batch count singly) have come since the start.
  std::vector<Received> waitFor(size_t count);
  std::vector<Received> received();
  size_t connectionCount();

 private:
  struct Peer;
  struct BusCloser {
    void operator()(sd_bus* bus) const noexcept;
  };
  struct Peer {
    std::unique_ptr<sd_bus, BusCloser> bus;
    bool isGone = false;
  };

  void run();
  void runTasks();
  void accept();
  void serve(Peer& peer);
  int handle(sd_bus_message* call);
  void record(std::vector<Received> calls);
  void post(std::function<void()> task);

  const std::string path_;
  UniqueFd listener_;
  UniqueFd wake_;
  std::list<Peer> peers_;  // of the daemon's thread

  std::mutex mutex_;
  std::condition_variable changed_;
  // Guarded by mutex_.
  std::vector<Received> received_;
  std::vector<std::function<void()>> tasks_;
  bool isEnding_ = false;
  size_t connections_ = 0;

  std::thread thread_;
};

}  // namespace tarnel::test
