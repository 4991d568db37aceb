// The list of the concrete back ends: beside the composition root the only place that names their classes.
#pragma once

#include <vector>

#include "backend/BackendFactory.h"
#include "config/Configuration.h"

namespace kyt {

// For DefaultBackendFactory, in the order in which names are compared. The configuration outlives the table.
[[nodiscard]] std::vector<BackendCreator> backendTable(Configuration& configuration);

}  // namespace kyt
