#pragma once

#include <memory>
#include <string>

#include "base/types.h"
#include "base/value.h"

// Code that is delivered apart from the daemon: a bundle is found by its path, loaded, and asked for a class
// by name; an instance of that class has its methods called by name.

namespace tarnel {

// One instance of a class of a bundle. What it is made of stays loaded as long as it lives.
//
// Threads: any, one call at a time; different instances may be called at the same time.
class BundleInstance {
 public:
  BundleInstance() = default;
  BundleInstance(const BundleInstance&) = delete;
  BundleInstance& operator=(const BundleInstance&) = delete;
  virtual ~BundleInstance() = default;

  // For logs.
  virtual std::string description() const = 0;
  // Whether the instance answers to the method now.
  virtual bool respondsTo(const char* methodName) = 0;
  // Calls the method by name with these arguments and returns when it has; the dictionary may be absent.
  // Nothing happens when the instance does not respond. What goes wrong inside is logged, not thrown.
  virtual void perform(const char* methodName, Method method, RespCode respCode,
                       const MaybeDictionary& dictionary) = 0;
};

// A class of a bundle. Threads: any.
class BundleClass {
 public:
  BundleClass() = default;
  BundleClass(const BundleClass&) = delete;
  BundleClass& operator=(const BundleClass&) = delete;
  virtual ~BundleClass() = default;

  // A new instance by the class's plain initializer; null when that gives none.
  virtual std::unique_ptr<BundleInstance> newInstance() = 0;
};

// A bundle that was found. Threads: any.
class CodeBundle {
 public:
  CodeBundle() = default;
  CodeBundle(const CodeBundle&) = delete;
  CodeBundle& operator=(const CodeBundle&) = delete;
  virtual ~CodeBundle() = default;

  virtual bool isLoaded() const = 0;
  // False, with a line in the log that says why and what to do, when the code cannot or may not be loaded.
  virtual bool load() = 0;
  // Null when the bundle is not loaded or has no such class.
  virtual std::shared_ptr<BundleClass> classNamed(const char* name) = 0;
};

// Where bundles are found. Threads: any.
class CodeBundles {
 public:
  CodeBundles() = default;
  CodeBundles(const CodeBundles&) = delete;
  CodeBundles& operator=(const CodeBundles&) = delete;
  virtual ~CodeBundles() = default;

  // The one bundle of that path; null, without a message, when there is none.
  virtual std::shared_ptr<CodeBundle> bundleWithPath(const std::string& path) = 0;
};

}  // namespace tarnel
