#pragma once

#include <string>
#include <utility>

#include "base/value.h"

// Inner documents of storebags.

namespace tarnel::test {

// An entry for the client and service "Meetwell" and "video-call" that reports everything to the addresses.
inline Dictionary clientEntry(const std::string& postURL, const std::string& realtimePostURL) {
  return {{"client", "Meetwell"},
          {"service", "video-call"},
          {"hierarchy", 0},
          {"locale_whitelist", Array{"DE"}},
          {"filters", Array()},
          {"sampling_threshold", 1},
          {"event_threshold", 49},
          {"post_url", postURL},
          {"realtime_post_url", realtimePostURL}};
}

inline Dictionary with(Dictionary dictionary, const std::string& key, Value value) {
  dictionary.set(key, std::move(value));
  return dictionary;
}

inline Dictionary without(Dictionary dictionary, const std::string& key) {
  dictionary.remove(key);
  return dictionary;
}

// One backend's section.
inline Dictionary profile(Array clients) {
  return {{"display_url", "https://display.example/"}, {"clients", std::move(clients)}};
}

// A whole storebag: the sections of its backends under every environment that is served without one of its
// own.
inline Dictionary storebag(const std::string& version, Dictionary backends) {
  return {{"version", version}, {"refresh_cycle", 3600}, {"release", std::move(backends)}};
}

}  // namespace tarnel::test
