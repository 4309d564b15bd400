#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>

#include "base/error.h"

namespace tarnel {

inline constexpr char kClientFileErrorDomain[] = "TarnelClientFileErrorDomain";

// A file that a client handed over for one upload: read through what the client opened, never by its path,
// which the daemon could not open. Its destruction releases it.
//
// Threads: the one that consumed the token.
class ClientFile {
 public:
  ClientFile() = default;
  ClientFile(const ClientFile&) = delete;
  ClientFile& operator=(const ClientFile&) = delete;
  virtual ~ClientFile() = default;

  // The user whose process handed it over, as the kernel says.
  virtual uint32_t owner() const = 0;
  // Neither a directory, device, pipe, socket nor link. Only a regular file may be read: nothing else is
  // sure not to block.
  virtual bool isRegular() const = 0;
  // Bytes, as it was when it was consumed.
  virtual uint64_t size() const = 0;
  // The first size() bytes: fewer when it has shrunk, no more when it has grown. The error says why it cannot
  // be read.
  virtual Result<std::string> contents() = 0;
  // Asks the client to delete the file, unless it has changed since it was consumed: what was not uploaded
  // must not be lost. Logs why it is kept. Does not wait for the client.
  virtual void requestDeletion() = 0;
};

// The files that clients hand over, by extension token: a text that says which file, and proves that the one
// who names it was given it.
//
// Threads: any.
class ClientFiles {
 public:
  ClientFiles() = default;
  ClientFiles(const ClientFiles&) = delete;
  ClientFiles& operator=(const ClientFiles&) = delete;
  virtual ~ClientFiles() = default;

  // The file, once for each token. Null, with a line in the log that says why, for a token that nobody gave,
  // that was consumed before, whose call has ended, or that belongs to another client's call.
  virtual std::unique_ptr<ClientFile> consume(const std::string& extensionToken) = 0;
};

}  // namespace tarnel
