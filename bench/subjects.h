/* What karst-bench measures, a file each: registers its subjects and what is asked of them. */
#pragma once

#include "bench/bench.h"
#include "bench/cluster.h"

namespace bench {

void measureMap(const Cluster &cluster);
void measureTrace(Cluster &cluster);
void measureReadOut(Cluster &cluster);
void measureChange(Cluster &cluster);
void measureRefreshes(Cluster &cluster);
void measureRescan(Cluster &cluster);
void measureMemory(Cluster &cluster); /* first: while nobody has instances */

}  // namespace bench
