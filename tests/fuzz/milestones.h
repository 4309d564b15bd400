#pragma once

#include <set>
#include <string>

namespace tarnel::fuzz {

// What this process reached so far.
std::set<std::string, std::less<>>& reachedMilestones();

}  // namespace tarnel::fuzz
