#include "tools/storebag/storebag_template.h"

#include "tarnel/keys.h"

namespace tarnel {

Dictionary newStorebagTemplate(const StorebagTemplate& from) {
  Array countries;
  for (const std::string& country : from.countries) countries.append(country);
  // Kept fields stand before the filters that would remove them: the first match decides.
  const Array filters = {
      Dictionary{{"method", 1}, {"status", 20}, {"key", "exampleLabel"}, {"action", "keep"}},
      Dictionary{{"key", "exampleLabel"}, {"action", "remove"}},
      Dictionary{{"key", "userName"}, {"action", "sha256"}}};
  const Dictionary entry = {{"client", from.client},
                            {"service", from.service},
                            {"hierarchy", 0},
                            {"override_dnu", 0},
                            {"locale_whitelist", countries},
                            {"filters", filters},
                            {"sampling_threshold", 1},
                            {"event_threshold", 49},
                            {"post_url", from.baseURL + "/v1/events"},
                            {"realtime_post_url", from.baseURL + "/v1/realtime"}};
  const Dictionary section = {
      {kTarnelBackendHTTPPost, Dictionary{{"display_url", from.baseURL + "/"}, {"clients", Array{entry}}}}};
  return {{"version", from.version}, {"refresh_cycle", 3600}, {"seed", section}, {"release", section}};
}

}  // namespace tarnel
