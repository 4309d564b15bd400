#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "base/log.h"
#include "base/unique_fd.h"
#include "ipc/client_files.h"
#include "ipc/server/connection_link.h"

namespace tarnel {

// The files of the uploads that are under way. The connection's thread offers the descriptor that came with a
// call; what it gets is the token that goes with the call. A token is made here, of random numbers no client
// sees, and is good once, on that thread, until the call has returned: so nobody can guess one, keep one for
// later, or use another's.
//
// Threads: any.
class ClientFileRegistry final : public ClientFiles {
 public:
  // The log must outlive the registry, and the registry every offer and file.
  explicit ClientFileRegistry(Log& log) : log_(log) {}

  // A file that can be consumed until this is destroyed.
  class Offer {
   public:
    Offer(ClientFileRegistry& registry, std::string token) : registry_(registry), token_(std::move(token)) {}
    Offer(const Offer&) = delete;
    Offer& operator=(const Offer&) = delete;
    ~Offer() { registry_.withdraw(token_); }
    const std::string& token() const noexcept { return token_; }

   private:
    ClientFileRegistry& registry_;
    const std::string token_;
  };
  // fileURL: as the client named it; it goes back with the wish to delete it. owner: the client's user. On
  // the connection's thread.
  Offer offer(UniqueFd file, std::string fileURL, std::shared_ptr<ConnectionLink> link, uint32_t owner);

  std::unique_ptr<ClientFile> consume(const std::string& extensionToken) override;

 private:
  struct Offered {
    UniqueFd file;
    std::string fileURL;
    std::shared_ptr<ConnectionLink> link;
    uint32_t owner;
    bool isConsumed = false;
  };

  void withdraw(const std::string& token);

  Log& log_;
  std::mutex mutex_;
  std::map<std::string, Offered> offered_;  // guarded by mutex_
};

}  // namespace tarnel
