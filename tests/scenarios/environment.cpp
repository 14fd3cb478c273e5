#include "scenario.h"

namespace scenarios {

std::vector<Scenario> environmentScenarios() { return {}; }

}  // namespace scenarios
