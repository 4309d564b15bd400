#include "tools/storebag/storebag_validation.h"

#include <arpa/inet.h>

#include <array>

#include "tarnel/keys.h"
#include "tools/storebag/storebag_findings.h"

namespace tarnel {
namespace {

using namespace storebag_check;

constexpr std::array kDocumentRules = {
    KeyRule{"version", Kind::text},           KeyRule{"refresh_cycle", Kind::number},
    KeyRule{"seed", Kind::dictionary},        KeyRule{"release", Kind::dictionary},
    KeyRule{"development", Kind::dictionary}, KeyRule{"orvane_internal", Kind::dictionary}};
constexpr std::array<std::string_view, 4> kSections = {"seed", "release", "development", "orvane_internal"};

constexpr std::array kBackendRules = {
    KeyRule{kTarnelBackendHTTPPost, Kind::dictionary},  KeyRule{kTarnelBackendHTTPPost2, Kind::dictionary},
    KeyRule{kTarnelBackendDashboard, Kind::dictionary}, KeyRule{kTarnelBackendUploadServer, Kind::dictionary},
    KeyRule{kTarnelBackendDravik, Kind::dictionary},    KeyRule{kTarnelBackendVesmer, Kind::dictionary}};

constexpr std::array kHTTPPostRules = {KeyRule{"clients", Kind::list}, KeyRule{"display_url", Kind::text},
                                       KeyRule{"active", Kind::number}};
constexpr std::array kDashboardRules = {
    KeyRule{"ip", Kind::text},          KeyRule{"port", Kind::anything}, KeyRule{"reliable", Kind::anything},
    KeyRule{"display_url", Kind::text}, KeyRule{"post_url", Kind::text}, KeyRule{"active", Kind::number}};
constexpr std::array kUploadRules = {KeyRule{"post_url", Kind::text}, KeyRule{"display_url", Kind::text},
                                     KeyRule{"active", Kind::number}};
constexpr std::array kForwardingRules = {KeyRule{"active", Kind::number}};

void checkHTTPPost(const Dictionary& profile, const std::string& path, Findings& findings) {
  checkKeys(profile, kHTTPPostRules, path, findings);
  checkURL(profile, "display_url", path, findings);
  const std::string clientsPath = joined(path, "clients");
  if (!profile.contains("clients")) {
    findings.error(clientsPath, "missing: the daemon makes no backend without a client list");
    return;
  }
  const Array* clients = findArray(profile, "clients");
  if (clients == nullptr) return;
  if (clients->empty()) findings.warning(clientsPath, "empty: no client reports here");
  for (size_t i = 0; i < clients->size(); ++i) {
    const Dictionary* entry = (*clients)[i].dictionary();
    if (entry == nullptr) {
      findings.error(indexed(clientsPath, i), "must be a dictionary, but is " + typeName((*clients)[i]));
    } else {
      checkClientEntry(*entry, indexed(clientsPath, i), findings);
    }
  }
}

// A number that the daemon reads whatever the kind of the value.
void checkLooseNumber(const Dictionary& profile, const char* key, const std::string& path,
                      Findings& findings) {
  const Value* value = profile.find(key);
  if (value->isNumber()) {
    checkInteger(profile, key, path, findings);
  } else {
    findings.warning(joined(path, key), "is " + typeName(*value) + " and counts as " +
                                            std::to_string(value->int64Value()) + ": write it as a number");
  }
}

void checkReliable(const Dictionary& profile, const std::string& path, Findings& findings) {
  constexpr double kLongest = 3600000;
  const Value* reliable = profile.find("reliable");
  if (reliable == nullptr) return;
  if (!reliable->hasInteger()) {
    findings.warning(joined(path, "reliable"),
                     "any value turns reliable delivery on, also " + typeName(*reliable) +
                         " without a number, which gets a period of 500 milliseconds: leave the key out to "
                         "turn it off");
  } else if (!(reliable->doubleValue() >= 1)) {
    findings.warning(joined(path, "reliable"),
                     "any value turns reliable delivery on, also 0 and false; it is the period in "
                     "milliseconds: leave the key out to turn it off");
  } else if (reliable->doubleValue() > kLongest) {
    findings.warning(joined(path, "reliable"), "counts as 3600000: an hour is the longest period");
  } else {
    checkLooseNumber(profile, "reliable", path, findings);
  }
}

void checkDashboard(const Dictionary& profile, const std::string& path, Findings& findings) {
  checkKeys(profile, kDashboardRules, path, findings);
  checkURL(profile, "display_url", path, findings);
  checkURL(profile, "post_url", path, findings);
  if (!profile.contains("ip")) {
    findings.error(joined(path, "ip"), "missing: the daemon makes no backend without the server's address");
  } else if (const std::string* ip = findString(profile, "ip")) {
    in_addr address{};
    if (inet_pton(AF_INET, ip->c_str(), &address) != 1) {
      findings.error(joined(path, "ip"), "must be an IPv4 address in dotted form, but is \"" + *ip + "\"");
    } else if (address.s_addr == INADDR_BROADCAST) {
      findings.error(joined(path, "ip"), "the daemon makes no backend for the broadcast address");
    }
  }
  const Value* port = profile.find("port");
  if (port == nullptr) {
    findings.error(joined(path, "port"), "missing: the daemon makes no backend without the server's port");
  } else if (!(port->doubleValue() >= 1 && port->doubleValue() < 65536)) {
    findings.error(joined(path, "port"), "must be a number from 1 to 65535");
  } else {
    checkLooseNumber(profile, "port", path, findings);
  }
  checkReliable(profile, path, findings);
}

void checkUploadServer(const Dictionary& profile, const std::string& path, Findings& findings) {
  checkKeys(profile, kUploadRules, path, findings);
  checkURL(profile, "post_url", path, findings);
  checkURL(profile, "display_url", path, findings);
  if (!profile.contains("post_url")) {
    findings.error(joined(path, "post_url"), "missing: the daemon makes no backend without it");
  }
}

void checkSection(const Dictionary& section, const std::string& path, Findings& findings) {
  if (section.empty()) findings.warning(path, "empty: sessions of this environment get no backend");
  for (const auto& [name, value] : section) {
    const std::string profilePath = joined(path, name);
    const bool known = std::any_of(kBackendRules.begin(), kBackendRules.end(),
                                   [&name](const KeyRule& rule) { return rule.key == name; });
    if (!known) {
      const std::string_view nearest = nearestKey(name, kBackendRules);
      findings.error(profilePath,
                     "unknown backend: the daemon makes none" +
                         (nearest.empty() ? std::string("; known are httppost, httppost2, dashboard, "
                                                        "uploadserver, dravik and vesmer")
                                          : "; did you mean \"" + std::string(nearest) + "\"?"));
      continue;
    }
    const Dictionary* profile = value.dictionary();
    if (profile == nullptr) {
      findings.error(profilePath, "must be a dictionary, but is " + typeName(value));
    } else if (name == kTarnelBackendHTTPPost || name == kTarnelBackendHTTPPost2) {
      checkHTTPPost(*profile, profilePath, findings);
    } else if (name == kTarnelBackendDashboard) {
      checkDashboard(*profile, profilePath, findings);
    } else if (name == kTarnelBackendUploadServer) {
      checkUploadServer(*profile, profilePath, findings);
    } else {
      checkKeys(*profile, kForwardingRules, profilePath, findings);
    }
  }
}

void checkRefreshCycle(const Dictionary& document, Findings& findings) {
  const Value* cycle = valueOf(document, "refresh_cycle", Kind::number);
  if (cycle == nullptr) return;
  if (cycle->doubleValue() >= 86401) {
    findings.warning("refresh_cycle", "counts as 86400: a day is the longest");
  } else if (!(cycle->doubleValue() >= 1)) {
    findings.warning("refresh_cycle", "every session fetches the storebag again, waiting for the server");
  } else {
    checkInteger(document, "refresh_cycle", "", findings);
  }
}

}  // namespace

std::vector<StorebagFinding> validateStorebag(const Value& inner) {
  Findings findings;
  const Dictionary* document = inner.dictionary();
  if (document == nullptr) {
    findings.error("", "the document's top level must be a dictionary, but is " + typeName(inner));
    return findings.take();
  }
  checkKeys(*document, kDocumentRules, "", findings);
  if (!document->contains("version")) {
    findings.error("version", "missing: the daemon refuses a storebag without a version");
  } else if (const std::string* version = findString(*document, "version"); version && version->empty()) {
    findings.warning("version", "empty: nobody can tell which storebag was in force");
  }
  if (document->contains("bag") && document->contains("signature")) {
    findings.error("", "this is a signed outer document: give the inner one");
  }
  checkRefreshCycle(*document, findings);
  for (const std::string_view name : kSections) {
    if (const Dictionary* section = findDictionary(*document, name)) {
      checkSection(*section, std::string(name), findings);
    }
  }
  if (findDictionary(*document, "release") == nullptr) {
    if (findDictionary(*document, "seed") == nullptr) {
      findings.error("release", "missing, and \"seed\" too: devices of customers find no section");
    } else {
      findings.warning("release", "missing: devices of the release environment find no section");
    }
  }
  return findings.take();
}

}  // namespace tarnel
