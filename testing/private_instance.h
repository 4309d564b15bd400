#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/value.h"
#include "testing/child_process.h"
#include "testing/test_folder.h"

namespace tarnel::test {

// The real daemon on directories of its own: configured, entitled for the user that runs the test, confined,
// unprivileged. Its log, at level debug, is the child's errors().
// Threads: one.
class PrivateInstance {
 public:
  PrivateInstance();
  PrivateInstance(const PrivateInstance&) = delete;
  PrivateInstance& operator=(const PrivateInstance&) = delete;
  ~PrivateInstance();

  const TestFolder& folder() const { return folder_; }
  std::string socketPath() const { return folder_.path("run/com.orvane.tarneld"); }
  // What the daemon and tarnelctl are told by their environment.
  std::vector<std::string> environment() const;

  // Before the start.
  void setLogLevel(std::string level) { logLevel_ = std::move(level); }
  void setConfiguration(std::string_view toml) const { folder_.write("config/tarneld.toml", toml); }
  void setEntitlements(std::string_view toml) const { folder_.write("config/entitlements.d/10.toml", toml); }
  // A folder with version and publicKey.der; without it the instance has no bundle.
  void setBundle(std::string folder) { bundle_ = std::move(folder); }
  // "NAME=value", for the daemon alone.
  void addVariable(std::string variable) { variables_.push_back(std::move(variable)); }
  void trust(std::string_view pem) const { folder_.write("config/trust.d/test.pem", pem); }

  // Also while it runs. A setting of com.orvane.tarnel, in the administrator's layer.
  void setSetting(const std::string& key, const Value& value);
  void setConsent(bool allowed) const;

  // Starts it and waits until it says that it is ready. False, with a failure of the test, when it is not.
  bool start();
  // The same without waiting, for a start that is not to succeed or that somebody kills.
  ChildProcess& launch(std::vector<int> listeningSockets = {});
  // After launch; waits for the daemon to be ready or to end.
  bool waitUntilReady();

  ChildProcess& daemon() const { return *daemon_; }
  std::string log() const { return daemon_->errors(); }
  size_t logSize() const { return daemon_->errors().size(); }
  // Waits for a text behind the position; a failure of the test when it does not come.
  bool waitForLog(std::string_view text, size_t from = 0) const;
  // How often the text stands in the log behind the position.
  size_t countInLog(std::string_view text, size_t from = 0) const;

  // Ends it in an orderly way, and expects that it does so without complaint of any sanitizer.
  void stop();
  // Ends it at once.
  void kill();
  // That it lives, and is confined.
  void expectAlive() const;

  // Everything in the message log.
  std::string messageLog() const;
  // Bytes of memory that the daemon holds.
  size_t residentBytes() const;

 private:
  ProcessOptions daemonOptions() const;
  void expectNoSanitizerReport() const;

  TestFolder folder_;
  std::string logLevel_ = "debug";
  std::string bundle_;
  std::vector<std::string> variables_;
  std::map<std::string, Value> settings_;
  UniqueFd notifications_;
  std::unique_ptr<ChildProcess> daemon_;
};

// How often the text stands in the other.
size_t countOf(std::string_view text, std::string_view in);

// False where a sanitizer keeps memory that was freed.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
inline constexpr bool kMemoryIsMeasurable = false;
#else
inline constexpr bool kMemoryIsMeasurable = true;
#endif

}  // namespace tarnel::test
