#pragma once

#include <memory>
#include <string>

#include "backends/tarnel_backend.h"

namespace tarnel {

// Uploads files of clients: compresses a file with gzip, posts it to the server that the profile's "post_url"
// names, and has it deleted when the server's reply says "success". Does nothing with messages.
//
// Threads: the owning session's, which an upload holds until its request has ended.
class UploadBackend final : public TarnelBackend {
 private:
  struct Private {};  // construction goes through initWithName

 public:
  // initWithName:profile:productFamily:
  // Null, with a line in the log, when the profile has no "post_url".
  static std::shared_ptr<UploadBackend> initWithName(const Dependencies& dependencies,
                                                     const std::string& name, const MaybeDictionary& profile,
                                                     const MaybeString& productFamily);
  UploadBackend(Private, const Dependencies& dependencies, const std::string& name,
                const MaybeDictionary& profile, const MaybeString& productFamily);

  // uploadFileAtPath:extensionToken:
  // path: names the file to the server and in the log; it is read through what the token stands for. True
  // when a request was made and has ended, whatever came of it; false when the HTTP client did not carry it
  // out, or the daemon ended first. An empty file is refused at once. A file larger than the limit is refused
  // before it is read; one that finds no room among the uploads under way, after a wait.
  bool uploadFileAtPath(const std::string& path, const std::string& extensionToken) override;

  const MaybeString& uploadURL() const noexcept { return _uploadURL; }
  void setUploadURL(const MaybeString& uploadURL) { _uploadURL = uploadURL; }

 private:
  // The file's contents; empty when it has none or cannot be read.
  std::string contentsOf(ClientFile& file, const std::string& path) const;
  std::string requestURL(const std::string& path) const;
  bool post(const std::string& path, std::string compressed, ClientFile& file) const;

  MaybeString _uploadURL;
};

}  // namespace tarnel
