#pragma once

#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "backends/https/list_matching.h"
#include "base/log.h"
#include "base/value.h"

namespace tarnel {

class ProfileSection;

// Reads a backend's section of the storebag for one operation. A signed document may still hold values of
// the wrong kind: each counts as absent (names excepted, see readNames), and each key that holds such a value
// is named in one warning, with the first place where it does.
//
// Threads: one at a time.
class ProfileReader {
 public:
  // `className`, `operation` and `backendName` stand in the warnings. Log and profile must outlive this
  // object and everything that it hands out.
  ProfileReader(Log& log, std::string backendName, const char* operation,
                const char* className = "HTTPSPostBackend");

  ProfileSection section(const Dictionary& profile);

 private:
  friend class ProfileSection;
  void warn(const std::string& shape, const std::string& place, const char* expected,
            const char* consequence = "counts as absent");

  Log& log_;
  std::string backendName_;
  const char* operation_;
  const char* className_;
  std::set<std::string> warned_;  // shapes, so that their number is that of the keys we know
};

// A dictionary of the profile with the place where it stands. Every lookup gives nothing for a missing key
// and, after a warning, for a value of another kind. What is returned lives as long as the profile.
class ProfileSection {
 public:
  const std::string* findString(std::string_view key) const;
  // Booleans are numbers, too.
  const Value* findNumber(std::string_view key) const;
  const Array* findArray(std::string_view key) const;
  // A value of any kind but null.
  const Value* findAny(std::string_view key) const;
  // The array's items that are dictionaries; empty without the array.
  std::vector<ProfileSection> findDictionaries(std::string_view key) const;
  // The array's items that are texts; nothing without the array.
  MaybeTextList findTexts(std::string_view key) const;

  // The names of a text, separated by commas; nothing without the key. False, after a warning, for a value of
  // another kind: nobody can tell for whom the section is meant, and it must not be for everybody.
  bool readNames(std::string_view key, MaybeTextList& names) const;

  // As numbers are read where a missing one is 0. Held to 32 bits.
  int32_t integerOrZero(std::string_view key) const;

 private:
  friend class ProfileReader;
  ProfileSection(ProfileReader& reader, const Dictionary& values, std::string shape, std::string place);
  void warn(std::string_view key, const char* expected) const;
  std::string shapeOf(std::string_view key) const { return shape_ + std::string(key); }
  std::string placeOf(std::string_view key) const { return place_ + std::string(key); }

  ProfileReader* reader_;
  const Dictionary* values_;
  std::string shape_;  // "clients[].filters[]."
  std::string place_;  // "clients[2].filters[0]."
};

}  // namespace tarnel
