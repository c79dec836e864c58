#pragma once

#include "bench/Measure.h"

namespace storix::bench {

/// Each measures one part of the system and adds its figures to the table.
void measureFloors(Table &table);
void measureRequests(Table &table);
void measureClaims(Table &table);
void measureStore(Table &table);
void measureQueues(Table &table);
void measureRegistry(Table &table);
void measureStartUp(Table &table);
void measureMemory(Table &table);
void measurePeers(Table &table);

}  // namespace storix::bench
