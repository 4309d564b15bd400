#pragma once

#include <cstdint>
#include <deque>
#include <string>
#include <string_view>

#include "base/error.h"
#include "base/unique_fd.h"
#include "tools/files/file_io.h"
#include "tools/receiving/notices.h"

namespace tarnel::lab {

// A file on its way into the folder; gone with the object unless it was kept.
class IncomingFile {
 public:
  IncomingFile(std::string folder, std::string name, UniqueFd fd);
  IncomingFile(IncomingFile&& other) noexcept;
  IncomingFile& operator=(IncomingFile&&) = delete;
  IncomingFile(const IncomingFile&) = delete;
  IncomingFile& operator=(const IncomingFile&) = delete;
  ~IncomingFile();

  // The name that it is going to have.
  const std::string& name() const { return name_; }
  std::string path() const { return folder_ + "/" + name_; }
  uint64_t size() const { return size_; }

  MaybeError write(std::string_view bytes);

 private:
  friend class StoredFiles;
  std::string incomingPath() const;

  std::string folder_;
  std::string name_;
  UniqueFd fd_;
  uint64_t size_ = 0;
};

// What strangers send, as files in one folder under names of our own, "20261120-142501-0001-NAME", each with
// a description beside it, "...-NAME.json". Nothing is ever overwritten; the oldest go when there are too
// many. Other files in the folder are left alone.
// Threads: one at a time.
class StoredFiles {
 public:
  struct Bounds {
    size_t files = 1000;
    uint64_t bytes = uint64_t{1} << 30U;  // with the descriptions
  };

  // notices outlives this object.
  StoredFiles(std::string folder, Notices& notices, Bounds bounds);

  // Reads what earlier runs left. The error names the folder.
  MaybeError open();

  // name: of a stranger; what is no letter, digit, "-", "_" or "." in it becomes "_", and of a long one the
  // last 100 bytes count. now: seconds since 1970.
  Result<IncomingFile> create(double now, std::string_view name);
  // Gives the file its name, puts the description beside it unless it is empty, and makes room. The error
  // names the file.
  MaybeError keep(IncomingFile& file, std::string_view description);

  const std::string& folder() const { return folder_; }

 private:
  struct Entry {
    std::string name;
    uint64_t size;
  };

  Result<IncomingFile> createNamed(const std::string& name) const;
  MaybeError giveName(IncomingFile& file) const;
  void makeRoom();

  const std::string folder_;
  Notices& notices_;
  const Bounds bounds_;
  std::deque<Entry> entries_;  // oldest first
  uint64_t bytes_ = 0;
  uint64_t number_ = 0;
};

// What may stand in the name of a file of ours, "_" for everything else; "file" when the name is empty.
std::string safeFileName(std::string_view name);
// Where the description of a stored file lies.
std::string descriptionOf(const std::string& path);
// Of the form that StoredFiles gives.
bool isStoredName(std::string_view name);

}  // namespace tarnel::lab
