#include "bench/Benchmarks.h"
namespace storix::bench {
void measurePeers(Table &table) { table.section("Peers"); }
}  // namespace storix::bench
