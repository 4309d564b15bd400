#include "ipc/server/client_file_registry.h"

#include <sys/random.h>
#include <sys/stat.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <utility>

#include "base/hex.h"
#include "ipc/protocol/wire.h"
#include "ipc/server/connection_loop.h"

namespace tarnel {
namespace {

// One read() each, so that the client's death or the daemon's end is not far when the storage is slow.
constexpr size_t kReadBytes = size_t{1} << 20U;

std::string newToken() {
  std::array<unsigned char, 16> bytes{};
  if (getrandom(bytes.data(), bytes.size(), 0) != static_cast<ssize_t>(bytes.size())) {
    throw std::system_error(errno, std::generic_category(), "getrandom");
  }
  return hexText(bytes);
}

// Read where it stands, whatever the client does with the descriptor's own position meanwhile.
class PassedFile final : public ClientFile {
 public:
  PassedFile(UniqueFd file, std::string fileURL, std::shared_ptr<ConnectionLink> link, uint32_t owner,
             Log& log)
      : file_(std::move(file)),
        fileURL_(std::move(fileURL)),
        link_(std::move(link)),
        owner_(owner),
        log_(log) {
    isKnown_ = fstat(file_.get(), &before_) == 0;
  }

  uint32_t owner() const override { return owner_; }
  bool isRegular() const override { return isKnown_ && S_ISREG(before_.st_mode); }
  uint64_t size() const override { return isKnown_ ? static_cast<uint64_t>(before_.st_size) : 0; }

  Result<std::string> contents() override {
    std::string contents;
    if (!isRegular()) return Error(kClientFileErrorDomain, EINVAL, "it is no regular file");
    contents.resize(size());
    size_t have = 0;
    while (have < contents.size()) {
      const auto got = pread(file_.get(), contents.data() + have,
                             std::min(kReadBytes, contents.size() - have), static_cast<off_t>(have));
      if (got < 0 && errno == EINTR) continue;
      if (got < 0) return Error(kClientFileErrorDomain, errno, std::strerror(errno));
      if (got == 0) break;
      have += static_cast<size_t>(got);
    }
    contents.resize(have);
    return contents;
  }

  void requestDeletion() override {
    if (const char* const why = change()) {
      kept(why);
      return;
    }
    auto* loop = link_->loopOfThisThread();
    if (loop == nullptr) {
      kept("its client's connection is over");
      return;
    }
    const auto append = [this](sd_bus_message* m) -> MaybeError {
      if (sd_bus_message_append(m, "s", fileURL_.c_str()) >= 0) return std::nullopt;
      return Error(wire::kErrorFailed, -1, "the message cannot hold the call");
    };
    if (const auto error = loop->callClient(wire::kDeleteFile.name, append)) {
      kept(error->localizedDescription().c_str());
    }
  }

 private:
  // What happened to the file since it came that keeps it from being deleted; null for nothing.
  const char* change() const {
    struct stat now {};
    if (fstat(file_.get(), &now) != 0 || now.st_size != before_.st_size ||
        now.st_mtim.tv_sec != before_.st_mtim.tv_sec || now.st_mtim.tv_nsec != before_.st_mtim.tv_nsec) {
      return "it changed while it was uploaded";
    }
    // Moving a file leaves their number as it is; the client sees to that itself.
    if (now.st_nlink < before_.st_nlink) return "a name of it was deleted, or given to another file";
    return nullptr;
  }
  void kept(const char* why) {
    TARNEL_LOG(log_, warning, "ClientFiles: %s was uploaded and is kept: %s", fileURL_.c_str(), why);
  }

  const UniqueFd file_;
  const std::string fileURL_;
  const std::shared_ptr<ConnectionLink> link_;
  const uint32_t owner_;
  Log& log_;
  struct stat before_ {};
  bool isKnown_ = false;
};

}  // namespace

ClientFileRegistry::Offer ClientFileRegistry::offer(UniqueFd file, std::string fileURL,
                                                    std::shared_ptr<ConnectionLink> link, uint32_t owner) {
  std::string token = newToken();
  const std::lock_guard lock(mutex_);
  offered_.emplace(token, Offered{std::move(file), std::move(fileURL), std::move(link), owner});
  return {*this, std::move(token)};
}

std::unique_ptr<ClientFile> ClientFileRegistry::consume(const std::string& extensionToken) {
  const char* why = nullptr;
  {
    const std::lock_guard lock(mutex_);
    const auto found = offered_.find(extensionToken);
    if (found == offered_.end()) {
      why = "no file was handed over with it, or its call has ended";
    } else if (found->second.link->loopOfThisThread() == nullptr) {
      why = "it belongs to another connection";
    } else if (std::exchange(found->second.isConsumed, true)) {
      why = "it was used before";
    } else {
      auto& offered = found->second;
      return std::make_unique<PassedFile>(std::move(offered.file), offered.fileURL, offered.link,
                                          offered.owner, log_);
    }
  }
  // The token itself is nobody's business, least of all a log's.
  TARNEL_LOG(log_, error, "ClientFiles: An extension token is refused: %s", why);
  return nullptr;
}

void ClientFileRegistry::withdraw(const std::string& token) {
  Offered gone{};  // closed without the lock
  const std::lock_guard lock(mutex_);
  const auto found = offered_.find(token);
  if (found == offered_.end()) return;
  gone = std::move(found->second);
  offered_.erase(found);
}

}  // namespace tarnel
