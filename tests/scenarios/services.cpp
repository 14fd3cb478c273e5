#include "scenario.h"

namespace scenarios {

std::vector<Scenario> servicesScenarios() { return {}; }

}  // namespace scenarios
