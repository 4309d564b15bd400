#pragma once

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/value.h"
#include "testing/child_process.h"
#include "testing/private_instance.h"
#include "testing/test_folder.h"

namespace tarnel::test {

// The real lab on a folder of its own: storebags over HTTPS, and what arrives.
// Threads: one.
class LabProcess {
 public:
  // Starts it and waits until it listens; throws when it does not.
  LabProcess();
  LabProcess(const LabProcess&) = delete;
  LabProcess& operator=(const LabProcess&) = delete;
  ~LabProcess();

  // One for all tests of a program: its keys take a while to make.
  static LabProcess& shared();

  const TestFolder& folder() const { return folder_; }
  std::string url() const { return text("url"); }
  std::string eventsURL() const { return text("eventsURL"); }
  std::string realtimeURL() const { return text("realtimeURL"); }
  std::string uploadURL() const { return text("uploadURL"); }
  std::string logDataURL() const { return text("logDataURL"); }
  uint16_t datagramPort() const { return static_cast<uint16_t>(number("datagramPort")); }
  std::string bundle() const { return text("bundle"); }
  std::string authorityPem() const { return readWholeFile(text("caFile")); }
  std::string storebagFolder() const { return text("storebagFolder"); }

  // An instance that trusts this lab and gets its storebags here.
  void connect(PrivateInstance& instance) const;

  // What is served under the name from now on.
  void serve(std::string_view name, const Dictionary& inner) const;
  void serveFile(std::string_view name, const std::string& path) const;
  void withdraw(std::string_view name) const;

  // The query of the control address, such as "status=503&for=events".
  void misbehave(const std::string& query) const;
  Dictionary status() const;
  int64_t storebagRequests() const;

  // Forgets what arrived so far and behaves well again.
  void reset();
  // What arrived since then, in the order of arrival: {"path", "headers", "clientId", "postTime", "event",
  // ...}.
  std::vector<Dictionary> events() const;
  // Posts with "problems" and without "event".
  std::vector<Dictionary> posts() const;
  // Files, log data and datagrams that arrived since then, a record each.
  std::vector<Dictionary> uploads() const;
  std::vector<Dictionary> logData() const;
  std::vector<Dictionary> datagrams() const;
  // Waits until as many events have arrived; a failure of the test when they do not. What there is then, in
  // the order in which it was posted.
  std::vector<Dictionary> waitForEvents(size_t count) const;
  // Waits for events of which the condition holds.
  bool waitUntil(const std::function<bool(const std::vector<Dictionary>&)>& holds) const;
  // The arrivals since then as the lab wrote them.
  std::string eventLines() const;

  // What it printed, one JSON object a line.
  const ChildProcess& process() const { return *process_; }

 private:
  std::string text(std::string_view key) const;
  int64_t number(std::string_view key) const;
  uint16_t controlPort() const;

  TestFolder folder_;
  std::unique_ptr<ChildProcess> process_;
  Dictionary started_;
  size_t eventsSeen_ = 0;  // bytes
  size_t postsSeen_ = 0;
  size_t uploadsSeen_ = 0;
  size_t logDataSeen_ = 0;
  size_t datagramsSeen_ = 0;
};

// The event inside an arrival.
const Dictionary& eventOf(const Dictionary& arrival);
// "7/0": the event's method and status.
std::string kindOf(const Dictionary& arrival);
std::vector<std::string> kindsOf(const std::vector<Dictionary>& arrivals);
// The text under the key; empty when there is none.
std::string textIn(const Dictionary& dictionary, std::string_view key);
int64_t numberIn(const Dictionary& dictionary, std::string_view key);

}  // namespace tarnel::test
