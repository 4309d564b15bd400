#include <algorithm>
#include <array>
#include <cmath>

#include "tools/storebag/storebag_findings.h"

namespace tarnel::storebag_check {
namespace {

constexpr std::array kEntryRules = {KeyRule{"client", Kind::text, true},
                                    KeyRule{"service", Kind::text, true},
                                    KeyRule{"expedite", Kind::number},
                                    KeyRule{"hierarchy", Kind::number},
                                    KeyRule{"override_dnu", Kind::number},
                                    KeyRule{"locale_whitelist", Kind::texts},
                                    KeyRule{"device_whitelist", Kind::texts},
                                    KeyRule{"device_blacklist", Kind::texts},
                                    KeyRule{"filters", Kind::list},
                                    KeyRule{"sampling_threshold", Kind::number},
                                    KeyRule{"per_country_sampling_thresholds", Kind::list},
                                    KeyRule{"override_sampling", Kind::number},
                                    KeyRule{"custom_clientId", Kind::any},
                                    KeyRule{"event_threshold", Kind::number},
                                    KeyRule{"extras_on_internal", Kind::number},
                                    KeyRule{"post_url", Kind::text},
                                    KeyRule{"realtime_post_url", Kind::text}};
constexpr std::array kFilterRules = {KeyRule{"method", Kind::number}, KeyRule{"status", Kind::number},
                                     KeyRule{"key", Kind::text}, KeyRule{"action", Kind::text}};
constexpr std::array kCountryThresholdRules = {KeyRule{"country", Kind::texts},
                                               KeyRule{"threshold", Kind::number}};

void checkNames(const Dictionary& entry, std::string_view key, const std::string& path, Findings& findings) {
  const std::string* names = findString(entry, key);
  if (names == nullptr) return;
  if (names->empty()) {
    findings.warning(joined(path, key), "empty: matches nothing; leave the key out to match everything");
  } else if (names->find(", ") != std::string::npos || names->find(" ,") != std::string::npos ||
             names->front() == ' ' || names->back() == ' ') {
    findings.warning(joined(path, key), "blanks beside a comma or at an end count as part of the name");
  }
}

void checkFraction(const Dictionary& dictionary, std::string_view key, const std::string& path,
                   Findings& findings) {
  const Value* number = valueOf(dictionary, key, Kind::number);
  if (number == nullptr) return;
  const double fraction = number->doubleValue();
  if (std::isnan(fraction)) {
    findings.warning(joined(path, key), "is not a number: no session comes to lie below it");
  } else if (fraction < 0 || fraction > 1) {
    findings.warning(joined(path, key), "is a share from 0 to 1, not a percentage: " +
                                            std::string(fraction > 1 ? "everything above 1 counts as all"
                                                                     : "nothing is below 0"));
  }
}

bool isCountryCode(const std::string& code) {
  return code.size() == 2 &&
         std::all_of(code.begin(), code.end(), [](char letter) { return letter >= 'A' && letter <= 'Z'; });
}

void checkCountries(const Dictionary& dictionary, std::string_view key, const std::string& path,
                    Findings& findings) {
  const Value* list = valueOf(dictionary, key, Kind::texts);
  if (list == nullptr) return;
  for (size_t i = 0; i < list->array()->size(); ++i) {
    const std::string& code = *(*list->array())[i].string();
    if (!isCountryCode(code)) {
      findings.warning(indexed(joined(path, key), i),
                       "\"" + code + "\" is no country code of two capital letters");
    }
  }
}

void checkDeviceList(const Dictionary& entry, std::string_view key, const std::string& path,
                     Findings& findings) {
  const Value* list = valueOf(entry, key, Kind::texts);
  if (list == nullptr) return;
  for (size_t i = 0; i < list->array()->size(); ++i) {
    if ((*list->array())[i].string()->empty()) {
      findings.warning(indexed(joined(path, key), i), "an empty text never matches");
    }
  }
}

void checkNumberRange(const Dictionary& filter, std::string_view key, const std::string& path,
                      Findings& findings) {
  const auto number = checkInteger(filter, key, path, findings);
  if (!number) return;
  if (*number > 65535) {
    findings.warning(joined(path, key), "no event has one above 65535: the filter never acts");
  } else if (*number < 0) {
    findings.warning(joined(path, key), "below 0 counts as any; leave the key out instead");
  }
}

void checkFilter(const Dictionary& filter, const std::string& path, Findings& findings) {
  checkKeys(filter, kFilterRules, path, findings);
  checkNumberRange(filter, "method", path, findings);
  checkNumberRange(filter, "status", path, findings);
  if (!filter.contains("key")) {
    findings.error(joined(path, "key"), "missing: the filter applies to no field");
  }
  const std::string* action = findString(filter, "action");
  if (action == nullptr) {
    if (!filter.contains("action")) {
      findings.warning(joined(path, "action"), "missing: the field is kept as it is");
    }
  } else if (*action != "remove" && *action != "sha256" && *action != "keep") {
    findings.warning(joined(path, "action"),
                     "\"" + *action +
                         "\" keeps the field as it is; the actions are \"remove\" and \"sha256\" "
                         "(and \"keep\", to say so)");
  }
}

void checkFilters(const Dictionary& entry, const std::string& path, Findings& findings) {
  const std::string filtersPath = joined(path, "filters");
  if (!entry.contains("filters")) {
    findings.error(filtersPath, "missing: the backend will stay disabled");
    return;
  }
  const Array* filters = findArray(entry, "filters");
  if (filters == nullptr) return;
  for (size_t i = 0; i < filters->size(); ++i) {
    const Dictionary* filter = (*filters)[i].dictionary();
    if (filter == nullptr) {
      findings.error(indexed(filtersPath, i), "must be a dictionary, but is " + typeName((*filters)[i]));
    } else {
      checkFilter(*filter, indexed(filtersPath, i), findings);
    }
  }
}

void checkCountryThresholds(const Dictionary& entry, const std::string& path, Findings& findings) {
  const Array* list = findArray(entry, "per_country_sampling_thresholds");
  if (list == nullptr) return;
  for (size_t i = 0; i < list->size(); ++i) {
    const std::string itemPath = indexed(joined(path, "per_country_sampling_thresholds"), i);
    const Dictionary* item = (*list)[i].dictionary();
    if (item == nullptr) {
      findings.error(itemPath, "must be a dictionary, but is " + typeName((*list)[i]));
      continue;
    }
    checkKeys(*item, kCountryThresholdRules, itemPath, findings);
    checkCountries(*item, "country", itemPath, findings);
    checkFraction(*item, "threshold", itemPath, findings);
    if (!item->contains("country")) findings.error(joined(itemPath, "country"), "missing: applies nowhere");
    if (!item->contains("threshold")) {
      findings.error(joined(itemPath, "threshold"), "missing: the backend stays disabled in these countries");
    }
  }
}

void checkThresholds(const Dictionary& entry, const std::string& path, Findings& findings) {
  if (!entry.contains("sampling_threshold")) {
    findings.error(joined(path, "sampling_threshold"),
                   "missing: the backend will stay disabled; 1 reports always");
  }
  checkFraction(entry, "sampling_threshold", path, findings);
  checkFraction(entry, "override_sampling", path, findings);
  const Value* sampling = valueOf(entry, "sampling_threshold", Kind::number);
  const Value* override = valueOf(entry, "override_sampling", Kind::number);
  if (sampling != nullptr && override != nullptr && override->doubleValue() < sampling->doubleValue()) {
    findings.warning(joined(path, "override_sampling"),
                     "below \"sampling_threshold\": no session is ever sampled out but live");
  }
  const auto threshold = checkInteger(entry, "event_threshold", path, findings);
  if (!entry.contains("event_threshold")) {
    findings.warning(joined(path, "event_threshold"),
                     "missing: counts as 0, so that the second event of any category posts the batch");
  } else if (threshold && *threshold < 0) {
    findings.warning(joined(path, "event_threshold"), "below 0: every event posts what is batched before it");
  }
}

void checkAddresses(const Dictionary& entry, const std::string& path, Findings& findings) {
  checkURL(entry, "post_url", path, findings);
  checkURL(entry, "realtime_post_url", path, findings);
  if (!entry.contains("post_url")) {
    findings.error(joined(path, "post_url"),
                   "missing: nothing can be posted unless the setting \"httpsPostURL\" names an address");
  }
}

}  // namespace

void checkClientEntry(const Dictionary& entry, const std::string& path, Findings& findings) {
  checkKeys(entry, kEntryRules, path, findings);
  checkNames(entry, "client", path, findings);
  checkNames(entry, "service", path, findings);
  for (const char* key : {"expedite", "extras_on_internal"}) checkInteger(entry, key, path, findings);
  const auto level = checkInteger(entry, "hierarchy", path, findings);
  if (level && *level < 0) {
    findings.warning(joined(path, "hierarchy"), "levels begin at 0: no other session finds one below");
  }
  const auto consent = checkInteger(entry, "override_dnu", path, findings);
  if (consent && *consent != 0 && *consent != 1) {
    findings.warning(joined(path, "override_dnu"), "only 1 overrides the user's consent; this counts as 0");
  }
  const Value* countries = entry.find("locale_whitelist");
  if (countries == nullptr || (countries->array() != nullptr && countries->array()->empty())) {
    findings.error(joined(path, "locale_whitelist"),
                   std::string(countries == nullptr ? "missing" : "empty") +
                       ": the backend will stay disabled in every country; list those that report");
  }
  checkCountries(entry, "locale_whitelist", path, findings);
  checkDeviceList(entry, "device_whitelist", path, findings);
  checkDeviceList(entry, "device_blacklist", path, findings);
  checkFilters(entry, path, findings);
  checkThresholds(entry, path, findings);
  checkCountryThresholds(entry, path, findings);
  checkAddresses(entry, path, findings);
}

}  // namespace tarnel::storebag_check
