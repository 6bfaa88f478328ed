#pragma once

#include "Sorvik/service/update_service.h"

namespace sorvik {

// The worker's long steps as the shipped plug-in carries them out: the update
// pipeline and the failover layer.
WorkerSteps& pluginSteps();

}  // namespace sorvik
