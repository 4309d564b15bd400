#pragma once

#include <sys/stat.h>

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "base/error.h"
#include "tools/storebag/storebag_key.h"
#include "tools/storebag/storebag_validation.h"

namespace tarnel::lab {

// What stands for the lab's own in a document; replaced before the document is parsed.
inline constexpr char kLabURLPlaceholder[] = "{{LAB_URL}}";
inline constexpr char kLabDatagramPortPlaceholder[] = "{{LAB_DATAGRAM_PORT}}";

// Where the lab itself listens.
struct OwnAddresses {
  std::string url;
  uint16_t datagramPort = 0;
};

// A storebag as it is served.
struct PreparedStorebag {
  std::string outer;         // signed
  std::string brokenOuter;   // the same with a signature that does not verify
  std::string version;       // empty when the document has none
  int64_t lastModified = 0;  // seconds since 1970; later than that of every earlier content under this name
  std::vector<StorebagFinding> findings;
};

// The inner documents NAME.json of one folder, signed when they are first asked for and again after each
// change of the file. Threads: any.
class StorebagSource {
 public:
  // started: seconds since 1970; nothing is dated before it, because another run may have served other
  // content (with another address, say) from the same file.
  StorebagSource(std::string folder, StorebagKey key, OwnAddresses lab, int64_t started);

  struct Lookup {
    std::shared_ptr<const PreparedStorebag> storebag;  // null: see error
    bool fresh = false;                                // prepared by this call
    bool missing = false;                              // there is no such file
    std::string error;                                 // with file, line and remedy
  };
  Lookup find(const std::string& name);

  // Names of the documents in the folder, sorted; at most 1000.
  std::vector<std::string> names() const;

 private:
  struct Entry {
    struct timespec changed {};
    struct timespec written {};
    off_t size = 0;
    ino_t inode = 0;
    std::string inner;
    std::shared_ptr<const PreparedStorebag> storebag;
    std::string error;

    bool isOf(const struct stat& status) const;
  };

  void refresh(Entry& entry, const std::string& path, const struct stat& status);

  const std::string folder_;
  const StorebagKey key_;
  const OwnAddresses lab_;
  const int64_t started_;
  std::mutex mutex_;
  std::map<std::string, Entry> entries_;
};

// Letters, digits, "-", "_" and ".", not first a ".", 64 at most: what may be part of a file name.
bool isStorebagName(std::string_view name);

// The answer to a conditional request: true when the client's copy (its If-Modified-Since) is as new.
bool isNotModified(const std::string* ifModifiedSince, int64_t lastModified);

}  // namespace tarnel::lab
