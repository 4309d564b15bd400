#include "platform/linux/bundles/dl_code_bundle.h"

#include <dlfcn.h>
#include <sys/stat.h>

#include <cerrno>
#include <exception>
#include <functional>
#include <optional>
#include <utility>
#include <vector>

#include "platform/linux/bundles/adaptor_values.h"
#include "platform/linux/bundles/trusted_path.h"
#include "tarnel/tarnel_adaptor.h"

namespace tarnel {

namespace {

constexpr char kEntry[] = "tarnel_adaptor_class_named";
using Entry = decltype(&tarnel_adaptor_class_named);

// Runs code of a bundle. Adaptors must not throw; one that does must not end the daemon.
template <class Call>
void guarded(Log& log, const char* what, const Call& call) {
  try {
    call();
  } catch (const std::exception& failure) {
    TARNEL_LOG(log, error, "callBundle: %s threw: %s", what, failure.what());
  } catch (...) {
    TARNEL_LOG(log, error, "callBundle: %s threw", what);
  }
}

class Instance final : public BundleInstance {
 public:
  Instance(const tarnel_adaptor_class& adaptorClass, void* object, std::string className, Log& log)
      : class_(adaptorClass), object_(object), className_(std::move(className)), log_(log) {}
  ~Instance() override {
    guarded(log_, "destroy", [this] { class_.destroy(object_); });
  }

  std::string description() const override { return "<" + className_ + ">"; }
  bool respondsTo(const char* methodName) override { return find(methodName) != nullptr; }
  void perform(const char* methodName, Method method, RespCode respCode,
               const MaybeDictionary& dictionary) override {
    const tarnel_adaptor_method function = find(methodName);
    if (function == nullptr) return;
    guarded(log_, methodName, [this, function, method, respCode, &dictionary] {
      function(object_, static_cast<uint16_t>(method), static_cast<uint16_t>(respCode),
               forAdaptor(dictionary));
    });
  }

 private:
  tarnel_adaptor_method find(const char* methodName) {
    tarnel_adaptor_method function = nullptr;
    guarded(log_, "find_method",
            [this, methodName, &function] { function = class_.find_method(object_, methodName); });
    return function;
  }

  const tarnel_adaptor_class& class_;
  void* const object_;
  const std::string className_;
  Log& log_;
};

class Class final : public BundleClass {
 public:
  Class(const tarnel_adaptor_class& adaptorClass, std::string name, Log& log)
      : class_(adaptorClass), name_(std::move(name)), log_(log) {}

  std::unique_ptr<BundleInstance> newInstance() override {
    void* object = nullptr;
    guarded(log_, "create", [this, &object] { object = class_.create(); });
    if (object == nullptr) return nullptr;
    return std::make_unique<Instance>(class_, object, name_, log_);
  }

 private:
  const tarnel_adaptor_class& class_;
  const std::string name_;
  Log& log_;
};

class Bundle final : public CodeBundle {
 public:
  Bundle(std::string library, Log& log)
      : library_(std::move(library)), log_(log), refusals_("loadBundle", log) {}

  bool isLoaded() const override {
    const std::lock_guard guard(mutex_);
    return entry_ != nullptr;
  }

  bool load() override {
    const std::lock_guard guard(mutex_);
    if (entry_ != nullptr) return true;
    if (const auto error = checkTrustedPath(library_)) return refuse(error->localizedDescription());
    // Held for ever: what a library started (threads, exit handlers) must not outlive its code.
    void* const handle = ::dlopen(library_.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) return refuse(library_ + ": cannot be loaded: " + loaderError());
    entry_ = reinterpret_cast<Entry>(::dlsym(handle, kEntry));
    if (entry_ != nullptr) return true;
    return refuse(library_ + ": does not export " + kEntry + "; see tarnel_adaptor.h");
  }

  std::shared_ptr<BundleClass> classNamed(const char* name) override {
    const std::lock_guard guard(mutex_);
    if (entry_ == nullptr) return nullptr;
    const tarnel_adaptor_class* found = nullptr;
    guarded(log_, kEntry,
            [this, name, &found] { found = entry_(TARNEL_ADAPTOR_VERSION, &adaptorValues(), name); });
    if (found == nullptr || !isUsable(*found, name)) return nullptr;
    return std::make_shared<Class>(*found, name, log_);
  }

 private:
  bool refuse(std::string text) {
    refusals_.report({{LogLevel::error, std::move(text)}});
    return false;
  }

  bool isUsable(const tarnel_adaptor_class& adaptorClass, const char* name) {
    if (adaptorClass.version != TARNEL_ADAPTOR_VERSION) {
      return refuse(library_ + ": its class " + name + " was built with version " +
                    std::to_string(adaptorClass.version) + " of tarnel_adaptor.h, the daemon with version " +
                    std::to_string(TARNEL_ADAPTOR_VERSION) + "; build it anew");
    }
    if (adaptorClass.create != nullptr && adaptorClass.destroy != nullptr &&
        adaptorClass.find_method != nullptr) {
      return true;
    }
    return refuse(library_ + ": its class " + name + " lacks create, destroy or find_method");
  }

  static std::string loaderError() {
    const char* text = ::dlerror();
    return text == nullptr ? "the loader does not say why" : text;
  }

  const std::string library_;
  Log& log_;
  OnceLog refusals_;
  mutable std::mutex mutex_;
  Entry entry_ = nullptr;
};

}  // namespace

std::string libraryOfBundle(const std::string& bundleFolder) {
  const std::string name = bundleFolder.substr(bundleFolder.rfind('/') + 1);
  return bundleFolder + "/" + name.substr(0, name.rfind('.')) + ".so";
}

DlCodeBundles::DlCodeBundles(std::string root, Log& log) : root_(std::move(root)), log_(log) {}
DlCodeBundles::~DlCodeBundles() = default;

std::shared_ptr<CodeBundle> DlCodeBundles::bundleWithPath(const std::string& path) {
  const std::string folder = root_ + path;
  struct stat status {};
  const bool isMissing = ::stat(folder.c_str(), &status) != 0 && (errno == ENOENT || errno == ENOTDIR);
  const std::lock_guard guard(mutex_);
  const auto known = bundles_.find(path);
  if (known != bundles_.end() && (!isMissing || known->second->isLoaded())) return known->second;
  if (isMissing) return nullptr;
  return bundles_[path] = std::make_shared<Bundle>(libraryOfBundle(folder), log_);
}

}  // namespace tarnel
