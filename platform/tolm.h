/* The product's kernel utilities: logs, worlds, heap sizing, scheduling, this host's role.
 *
 * Remarks as in zel.h: does the call block, may a spinlock be held.
 */
#ifndef PLATFORM_TOLM_H
#define PLATFORM_TOLM_H

#include "platform/zel.h"

#ifdef __cplusplus
extern "C" {
#endif

/* Opens the module's log under `name` and stores its handle. `level` is the log's first level and
 * `flags` is 0. ZEL_OK or ZEL_NO_MEMORY. Blocks: yes. Under a spinlock: no. */
zel_Status Tolm_LogInit(const char *name, zel_ModuleID moduleID, uint32_t level, uint32_t flags,
                        zel_Log **log);

/* Closes the log and stores null in *log. Blocks: yes. Under a spinlock: no. */
void Tolm_LogCleanup(zel_Log **log);

/* Starts a world that runs body(data), and stores its ID, never ZEL_NO_WORLD, in *world. The ID is
 * stored atomically, and before the world first runs, so that whatever the world's own work makes
 * others do may use it. `flags` is 1. The world's record comes from `heap`. ZEL_OK; ZEL_NO_MEMORY;
 * on failure *world is left alone. Blocks: yes. Under a spinlock: no. */
zel_Status TOLM_WorldCreate(zel_WorldID *world, const char *name, zel_ModuleID moduleID,
                            uint32_t (*body)(void *data), void *data, uint32_t flags,
                            zel_HeapID heap);

/* Asks the world to stop (its wait returns ZEL_WORLD_STOPPING), returns when its body has returned,
 * and stores ZEL_NO_WORLD, atomically. A world that was never created (ZEL_NO_WORLD) is accepted.
 * Blocks: yes. Under a spinlock: no. */
void TOLM_WorldDestroy(zel_WorldID *world);

/* Heap space, in bytes, that one allocation of `bytes` consumes. Blocks: no. Under a spinlock:
 * yes. */
uint32_t tolmapi_HeapRequest2Size(uint32_t bytes);

/* Makes the calling world preemptible. Blocks: no. Under a spinlock: no. */
void tolmapi_PreemptionEnable(void);

/* Does somebody wait for a lock that the calling world has held for longer than its time slice?
 * Between two true answers at least one false one comes, so that a world that gives way to each of
 * them still gets on. Blocks: no. Under a spinlock: yes, that is what it is for. */
bool tolmapi_PreemptionIsPending(void);

/* Number of the physical processor that the caller runs on at the moment. Blocks: no. Under a
 * spinlock: yes. */
uint32_t tolmapi_GetPCPUNumPreemptible(void);

/* Return address of a frame on the caller's stack, found through the frame pointers: frame 0 is
 * where the calling function returns to, frame 1 where that function returns to, and so on. 0 where
 * the chain ends. Blocks: no. Under a spinlock: yes. */
uint64_t tolmapi_GetReturnAddress(uint32_t frame);

/* Is this host a witness node? Blocks: no. Under a spinlock: yes. */
bool TOLM_IsWitnessNode(void);

#ifdef __cplusplus
}
#endif

#endif
