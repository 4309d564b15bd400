#pragma once

#include <functional>

#include "tools/lab/receivers/datagram_faults.h"
#include "tools/lab/receivers/misbehaviour.h"
#include "tools/receiving/arrival_store.h"
#include "tools/receiving/http_message.h"

namespace tarnel::lab {

// What stands behind the control address. Requests that a web page of another site makes in a browser are
// refused. Threads: any.
class Control final : public HttpHandler {
 public:
  struct Parts {
    ArrivalStore& store;
    Misbehaviours& misbehaviours;
    DatagramFaults& datagramFaults;
    std::string logDataFolder;
    std::function<Dictionary()> status;
    std::function<void()> stop;
  };

  explicit Control(Parts parts) : parts_(std::move(parts)) {}

  size_t maxBodyBytes(const HttpRequest&) const override { return kMaxBodyBytes; }
  HttpAnswer answer(const HttpRequest& request) override;
  // What is set, datagrams with it.
  Array misbehaviours() const;
  void connectionFailed(const std::string&, const std::string&) override {}

 private:
  static constexpr size_t kMaxBodyBytes = 64U << 10U;

  HttpAnswer list(const HttpRequest& request) const;
  HttpAnswer logRecords(const std::string& name) const;
  HttpAnswer misbehave(const HttpRequest& request);
  MaybeError setMisbehaviour(const NameValues& query);

  const Parts parts_;
};

}  // namespace tarnel::lab
