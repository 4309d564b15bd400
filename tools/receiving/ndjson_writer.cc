#include "tools/receiving/ndjson_writer.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "base/unique_fd.h"
#include "formats/document.h"

namespace tarnel::lab {

NdjsonWriter::NdjsonWriter(std::string folder, Notices& notices, uint64_t maxFileBytes)
    : notices_(notices), maxFileBytes_(maxFileBytes) {
  events_.path = folder + "/events.ndjson";
  posts_.path = folder + "/posts.ndjson";
  uploads_.path = folder + "/uploads.ndjson";
  logData_.path = folder + "/log-data.ndjson";
  datagrams_.path = std::move(folder) + "/datagrams.ndjson";
}

MaybeError NdjsonWriter::open() {
  for (File* file : {&events_, &posts_, &uploads_, &logData_, &datagrams_}) {
    if (MaybeError error = openFile(*file)) return error;
  }
  return std::nullopt;
}

MaybeError NdjsonWriter::openFile(File& file) {
  file.fd = UniqueFd(::open(file.path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600));
  struct stat status {};
  if (!file.fd || ::fstat(file.fd.get(), &status) != 0) return fileError("write", file.path, errno);
  file.size = static_cast<uint64_t>(status.st_size);
  return std::nullopt;
}

MaybeError NdjsonWriter::append(File& file, const std::string& lines) {
  struct stat status {};
  const bool gone = ::stat(file.path.c_str(), &status) != 0 && errno == ENOENT;
  const bool full = !gone && file.size > 0 && file.size + lines.size() > maxFileBytes_;
  if (full && ::rename(file.path.c_str(), (file.path + ".1").c_str()) != 0) {
    return fileError("rename", file.path, errno);
  }
  if (gone || full) {
    if (MaybeError error = openFile(file)) return error;
  }
  for (std::string_view left = lines; !left.empty();) {
    const ssize_t written = ::write(file.fd.get(), left.data(), left.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return fileError("write", file.path, errno);
    file.size += static_cast<uint64_t>(written);
    left.remove_prefix(static_cast<size_t>(written));
  }
  return std::nullopt;
}

void NdjsonWriter::arrived(const Arrival& arrival) {
  std::string lines;
  for (const Value& event : arrival.events) lines += writeTextDocument(recordOfEvent(arrival, event)) + "\n";
  MaybeError error = append(events_, lines);
  if (!error) error = append(posts_, writeTextDocument(recordOfPost(arrival, false)) + "\n");
  told(error);
}

void NdjsonWriter::uploadArrived(const UploadArrival& arrival) {
  appendRecord(uploads_, recordOfUpload(arrival));
}

void NdjsonWriter::logDataArrived(const LogDataArrival& arrival) {
  appendRecord(logData_, recordOfLogData(arrival, false));
}

void NdjsonWriter::datagramArrived(const DatagramArrival& arrival) {
  appendRecord(datagrams_, recordOfDatagram(arrival));
}

void NdjsonWriter::appendRecord(File& file, const Dictionary& record) {
  told(append(file, writeTextDocument(record) + "\n"));
}

void NdjsonWriter::told(const MaybeError& error) {
  if (error && !failing_) {
    notices_.warning(error->localizedDescription() + "; what arrives is not kept on disk meanwhile");
  }
  failing_ = error.has_value();
}

}  // namespace tarnel::lab
