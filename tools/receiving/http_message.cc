#include "tools/receiving/http_message.h"

#include <algorithm>

#include "tools/receiving/text.h"

namespace tarnel::lab {

const std::string* findHeader(const NameValues& headers, std::string_view name) {
  const std::string wanted = lowerCased(name);
  const auto found = std::find_if(headers.begin(), headers.end(), [&wanted](const auto& header) {
    return header.first.size() == wanted.size() && lowerCased(header.first) == wanted;
  });
  return found == headers.end() ? nullptr : &found->second;
}

const std::string* findParameter(const NameValues& query, std::string_view name) {
  const auto found = std::find_if(query.begin(), query.end(),
                                  [name](const auto& parameter) { return parameter.first == name; });
  return found == query.end() ? nullptr : &found->second;
}

}  // namespace tarnel::lab
