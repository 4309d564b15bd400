#include "tools/lab/lab_directory.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>

#include "base/unique_fd.h"

namespace tarnel::lab {
namespace {

constexpr mode_t kPrivate = 0700;
constexpr mode_t kPublic = 0755;

std::string absolutePath(const std::string& path) {
  std::error_code error;
  const std::filesystem::path absolute = std::filesystem::absolute(path, error);
  std::string text = error ? path : absolute.lexically_normal().string();
  while (text.size() > 1 && text.back() == '/') text.pop_back();
  return text;
}

Error withRemedy(const Error& error) {
  return Error(error.domain(), error.code(),
               error.localizedDescription() + "; choose a folder that you may write with --directory");
}

Result<UniqueFd> lockDirectory(const std::string& directory) {
  const std::string path = directory + "/lock";
  UniqueFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (!fd) return withRemedy(fileError("write", path, errno));
  if (::flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
    return Error(
        kToolErrorDomain, EBUSY,
        "another tarnel-lab uses " + directory + "; end it, or choose another folder with --directory");
  }
  return fd;
}

Result<StorebagKey> ensureKey(const LabPaths& paths, std::vector<std::string>& made) {
  if (pathExists(paths.storebagKey)) return StorebagKey::load(paths.storebagKey);
  Result<StorebagKey> key = StorebagKey::generate();
  if (!key) return key;
  if (MaybeError error = key->save(paths.storebagKey)) return *error;
  made.push_back("made the key that signs storebags, " + paths.storebagKey);
  return key;
}

MaybeError makeFolders(const LabPaths& paths) {
  if (MaybeError error = makeDirectory(paths.directory, kPublic)) return error;
  if (MaybeError error = makeDirectory(paths.storebags, kPublic)) return error;
  for (const std::string& folder : {paths.arrivals, paths.uploads, paths.logData}) {
    if (MaybeError error = makeDirectory(folder, kPrivate)) return error;
  }
  return std::nullopt;
}

}  // namespace

LabPaths::LabPaths(const std::string& given)
    : directory(absolutePath(given)),
      certificates{.authority = directory + "/ca.pem",
                   .authorityKey = directory + "/ca-key.pem",
                   .server = directory + "/server.pem",
                   .serverKey = directory + "/server-key.pem"},
      storebagKey(directory + "/storebag-key.pem"),
      bundle(directory + "/bundle"),
      storebags(directory + "/storebags"),
      arrivals(directory + "/arrivals"),
      uploads(directory + "/uploads"),
      logData(directory + "/log-data") {}

Result<LabDirectory> openLabDirectory(const std::string& directory, const std::vector<std::string>& names,
                                      const std::string& bundleVersion, std::time_t now) {
  const LabPaths paths(directory);
  std::vector<std::string> made;
  if (const MaybeError error = makeFolders(paths)) return withRemedy(*error);
  Result<UniqueFd> lock = lockDirectory(paths.directory);
  if (!lock) return lock.error();
  const Result<CertificateWork> work = ensureCertificates(paths.certificates, names, now);
  if (!work) return work.error();
  if (work->madeAuthority) made.push_back("made a certificate authority, " + paths.certificates.authority);
  if (work->madeServerBecause) made.push_back("made a server certificate: " + *work->madeServerBecause);
  Result<StorebagKey> key = ensureKey(paths, made);
  if (!key) return key.error();
  if (const MaybeError error = writeClientBundle(paths.bundle, *key, bundleVersion))
    return withRemedy(*error);
  return LabDirectory{
      .paths = paths, .key = *std::move(key), .lock = *std::move(lock), .made = std::move(made)};
}

}  // namespace tarnel::lab
