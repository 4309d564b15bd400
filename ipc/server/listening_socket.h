#pragma once

#include <string>

#include "base/error.h"
#include "base/unique_fd.h"

// The socket that clients connect to.

namespace tarnel {

class ListeningSocket {
 public:
  // The one that the service manager passed: that of the name, else the first Unix stream socket that
  // listens. Empty when there is none.
  static ListeningSocket fromServiceManager(const std::string& name);

  // Makes the socket at the path, open to every user. The file of a daemon that is gone is replaced; an
  // error when another daemon listens there, when the path is no socket's, or too long.
  static Result<ListeningSocket> make(const std::string& path);

  ListeningSocket() = default;
  ListeningSocket(ListeningSocket&&) noexcept = default;
  ListeningSocket& operator=(ListeningSocket&&) noexcept = default;
  // Takes the file away again, when it was made here and is still the same.
  ~ListeningSocket();

  int get() const noexcept { return socket_.get(); }
  explicit operator bool() const noexcept { return static_cast<bool>(socket_); }

 private:
  UniqueFd socket_;
  std::string madePath_;
};

}  // namespace tarnel
