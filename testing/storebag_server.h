#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

#include "base/value.h"
#include "testing/private_instance.h"
#include "testing/raw_http_server.h"
#include "testing/test_folder.h"
#include "tools/storebag/storebag_key.h"

namespace tarnel::test {

// A storebag server under the test's control, byte by byte. Threads: any.
class StorebagServer {
 public:
  // Answers one request for a storebag; the connection ends when it returns false.
  using Behaviour = std::function<bool(RawConnection& connection, const std::string& request)>;

  // The key that signs, made once for the program.
  static const StorebagKey& key();
  // Another one, which nobody trusts.
  static const StorebagKey& foreignKey();
  // A signed outer document.
  static std::string sign(std::string_view inner, const StorebagKey& with = key());

  explicit StorebagServer(std::optional<TlsIdentity> identity = std::nullopt);

  // The instance gets its storebags here, with the key that verifies them.
  void connect(PrivateInstance& instance) const;
  std::string url() const { return server_.url(""); }

  void behave(const std::string& name, Behaviour behaviour);
  // Answers with exactly these bytes and closes.
  void say(const std::string& name, const std::string& bytes);
  // A whole answer with status 200.
  void answer(const std::string& name, const std::string& body, const std::string& headerLines = "");
  void serve(const std::string& name, const Dictionary& inner);

  int requests(const std::string& name) const;

 private:
  bool answerRequest(RawConnection& connection, const std::string& request);

  TestFolder bundle_;
  mutable std::mutex mutex_;
  // Guarded by mutex_.
  std::map<std::string, Behaviour> behaviours_;
  std::map<std::string, int> requests_;
  RawHttpServer server_;  // the last: its threads use the rest
};

}  // namespace tarnel::test
