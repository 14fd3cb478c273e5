#include "scenario.h"

namespace scenarios {

std::vector<Scenario> accountScenarios() { return {}; }

}  // namespace scenarios
