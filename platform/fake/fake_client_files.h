#pragma once

#include <cerrno>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "ipc/client_files.h"

namespace tarnel::fake {

// Files by token, set up by the test. Threads: one at a time.
class FakeClientFiles final : public ClientFiles {
 public:
  struct File {
    std::string text;
    bool isRegular = true;
    uint32_t owner = 0;
    uint64_t claimedSize = UINT64_MAX;  // the text's, unless said otherwise
    MaybeError readError;
  };

  std::map<std::string, File> files;
  // What was done, in order: "consume t", "read t", "delete t", "release t".
  std::vector<std::string> journal;
  std::function<void()> onRead;  // called while a file is read

  std::unique_ptr<ClientFile> consume(const std::string& extensionToken) override {
    journal.push_back("consume " + extensionToken);
    const auto found = files.find(extensionToken);
    return found == files.end() ? nullptr : std::make_unique<Handle>(*this, extensionToken, found->second);
  }

 private:
  class Handle final : public ClientFile {
   public:
    Handle(FakeClientFiles& owner, std::string token, File file)
        : owner_(owner), token_(std::move(token)), file_(std::move(file)) {}
    ~Handle() override { owner_.journal.push_back("release " + token_); }
    uint32_t owner() const override { return file_.owner; }
    bool isRegular() const override { return file_.isRegular; }
    uint64_t size() const override {
      return file_.claimedSize == UINT64_MAX ? file_.text.size() : file_.claimedSize;
    }
    Result<std::string> contents() override {
      owner_.journal.push_back("read " + token_);
      if (owner_.onRead) owner_.onRead();
      if (file_.readError) return *file_.readError;
      return file_.text.substr(0, size());
    }
    void requestDeletion() override { owner_.journal.push_back("delete " + token_); }

   private:
    FakeClientFiles& owner_;
    const std::string token_;
    const File file_;
  };
};

}  // namespace tarnel::fake
