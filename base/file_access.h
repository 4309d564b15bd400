#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/error.h"
#include "base/unique_fd.h"

// Reading and replacing small files whole, and the rule by which a file is trusted. Errors carry
// kFileErrorDomain, the errno as code, and a text with the file's name.
//
// Threads: any.

namespace tarnel {

// Tells one state of a file from another: replaced or written in place, it differs.
struct FileIdentity {
  uint64_t device = 0;
  uint64_t inode = 0;
  int64_t size = 0;
  int64_t modifiedNanoseconds = 0;
  int64_t changedNanoseconds = 0;
  friend bool operator==(const FileIdentity&, const FileIdentity&) = default;
};

struct FileContents {
  std::string text;
  FileIdentity identity;
};

// What a file may be.
enum class FileTrust {
  any,      // whoever can read it may use it
  trusted,  // owned by root or by this process's user, and neither the file nor its directory may be
            // written by anybody else
};

// Why a file or directory of that status is not `trusted`, with the remedy; nothing when it is. `kind` begins
// the text ("it", "its directory").
std::optional<std::string> distrust(const std::string& path, const struct stat& status, const char* kind);

// A configuration, settings or profile file is never larger.
inline constexpr size_t kMaxFileBytes = 1U << 20U;

// Nothing when there is no such file.
std::optional<FileIdentity> fileIdentity(const std::string& path);

// The whole regular file. Fails with ENOENT when there is none, EFBIG beyond the limit, and EPERM when it
// must be trusted and is not; that text names the reason and the remedy.
Result<FileContents> readFile(const std::string& path, FileTrust trust = FileTrust::any,
                              size_t maxBytes = kMaxFileBytes);

// The first line of a file without blanks at its ends; nothing when it cannot be read or is empty.
std::optional<std::string> readFirstLine(const std::string& path);

// Puts the text in place of the file, durably before it returns: whoever looks, at any instant and after
// any crash, finds the old file or the new one. The file's directory must exist; when root writes, the file
// goes to that directory's owner, so that the daemon can still read its own.
MaybeError replaceFile(const std::string& path, std::string_view text, unsigned mode);

// Names of the directory's entries that end so, sorted; empty when there is no such directory.
std::vector<std::string> sortedEntries(const std::string& directory, std::string_view ending);

// The error for the current errno: "<path>: <action>: <system's text>".
Error systemError(const std::string& path, const char* action);

// Waits for the lock of the file (flock), creating it when it is missing. The lock goes with the descriptor.
// A file that root makes goes to its directory's owner.
Result<UniqueFd> lockFile(const std::string& path);

}  // namespace tarnel
