/* Which lock guards which field of the module's structures, for the recorder of memory accesses; the
 * one table of what may be touched without a lock, each line with its reason. One OS thread, no lock.
 */
#pragma once

#include "host/kernel/module_loader.h"
#include "karst_resolver/model.h"
#include "sim/simulation.h"

/* These do nothing where accesses are not recorded. The first declares what belongs to a cache, and
 * the instances, while nobody but the loading fiber knows of the cache; the second the variables of
 * a module that is loaded. */
void declareCacheGuards(sim::Simulation &simulation, const KARSTResolverCache &cache);
void declareVariableGuards(sim::Simulation &simulation, const host::Module &module);

/* Takes them all back, once the module is unloaded. */
void withdrawGuards(sim::Simulation &simulation);
