#pragma once

#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/code_bundle.h"

namespace tarnel::fake {

// What bundles were asked to do, in order. Threads: any.
class BundleJournal {
 public:
  struct Call {
    int instance;  // counted from 1
    std::string method;
    Method first;
    RespCode second;
    MaybeDictionary dictionary;
  };
  void add(std::string line) {
    const std::lock_guard guard(mutex_);
    lines_.push_back(std::move(line));
  }
  void add(Call call) {
    const std::lock_guard guard(mutex_);
    calls_.push_back(std::move(call));
  }
  std::vector<std::string> lines() const {
    const std::lock_guard guard(mutex_);
    return lines_;
  }
  std::vector<Call> calls() const {
    const std::lock_guard guard(mutex_);
    return calls_;
  }
  int nextInstance() {
    const std::lock_guard guard(mutex_);
    return ++instances_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
  std::vector<Call> calls_;
  int instances_ = 0;
};

// How the one bundle behaves. Set up before threads start.
struct BundleScript {
  bool loads = true;
  bool isLoaded = false;
  std::string className = "DravikAdaptor";
  bool makesInstances = true;
  std::string methodName = "sendMessageWithMethod:respCode:dict:";
};

// The bundles that the test put into `scripts`, by path.
class FakeCodeBundles final : public CodeBundles {
 public:
  std::map<std::string, BundleScript> scripts;
  BundleJournal journal;

  std::shared_ptr<CodeBundle> bundleWithPath(const std::string& path) override {
    journal.add("bundle " + path);
    const auto script = scripts.find(path);
    return script == scripts.end() ? nullptr : std::make_shared<Bundle>(script->second, journal);
  }

 private:
  class Instance final : public BundleInstance {
   public:
    Instance(const BundleScript& script, BundleJournal& journal) : script_(script), journal_(journal) {
      journal_.add("made " + std::to_string(number_));
    }
    ~Instance() override { journal_.add("destroyed " + std::to_string(number_)); }
    std::string description() const override { return "<" + script_.className + ">"; }
    bool respondsTo(const char* methodName) override { return methodName == script_.methodName; }
    void perform(const char* methodName, Method method, RespCode respCode,
                 const MaybeDictionary& dictionary) override {
      journal_.add({number_, methodName, method, respCode, dictionary});
    }

   private:
    const BundleScript& script_;
    BundleJournal& journal_;
    const int number_ = journal_.nextInstance();
  };

  class Class final : public BundleClass {
   public:
    Class(const BundleScript& script, BundleJournal& journal) : script_(script), journal_(journal) {}
    std::unique_ptr<BundleInstance> newInstance() override {
      if (!script_.makesInstances) return nullptr;
      return std::make_unique<Instance>(script_, journal_);
    }

   private:
    const BundleScript& script_;
    BundleJournal& journal_;
  };

  class Bundle final : public CodeBundle {
   public:
    Bundle(BundleScript& script, BundleJournal& journal) : script_(script), journal_(journal) {}
    ~Bundle() override { journal_.add("released the bundle"); }
    bool isLoaded() const override { return script_.isLoaded; }
    bool load() override {
      journal_.add("load");
      return script_.isLoaded = script_.loads;
    }
    std::shared_ptr<BundleClass> classNamed(const char* name) override {
      journal_.add(std::string("class ") + name);
      if (!script_.isLoaded || name != script_.className) return nullptr;
      return std::make_shared<Class>(script_, journal_);
    }

   private:
    BundleScript& script_;
    BundleJournal& journal_;
  };
};

}  // namespace tarnel::fake
