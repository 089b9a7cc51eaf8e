/* The platform's C functions that only pass on to the host: heaps, text, log, panic, the directory
 * and this host's role. The others stand with what they do, in threads/, directory/ and tracing/.
 * No lock here. sim/ has these functions again, for its own scheduler and faults.
 */
#include <cstdio>

#include "host/host_kernel.h"
#include "host/kernel/frames.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "host/platform.h"
#include "platform/expr_msh.h"
#include "platform/qxt.h"
#include "platform/tolm.h"
#include "platform/tracing.h"

using host::Kernel;

/* ---- Text ------------------------------------------------------------------------------------ */

const char *zel_StatusToString(zel_Status status) {
  return host::statusText(status);
}

void zel_NameInitialize(zel_Name *name, const char *text) {
  host::fillName(name, text);
}

int zel_Snprintf(char *buffer, size_t size, const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const int length = std::vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  return length;
}

/* ---- Heaps ----------------------------------------------------------------------------------- */

zel_Status zel_HeapCreate(const zel_HeapProps *props, zel_HeapID *heap) {
  return host::heapCreate(*props, heap);
}

void zel_HeapDestroy(zel_HeapID heap) {
  host::heapDestroy(heap);
}

void *zel_HeapAllocWithRA(zel_HeapID heap, uint32_t size, void *returnAddress) {
  return host::heapAlloc(heap, size, returnAddress);
}

void zel_HeapFree(zel_HeapID heap, void *block) {
  host::heapFree(heap, block);
}

uint32_t tolmapi_HeapRequest2Size(uint32_t bytes) {
  return host::heapSpaceFor(bytes);
}

/* ---- Log and panic --------------------------------------------------------------------------- */

zel_Status Tolm_LogInit(const char *name, zel_ModuleID moduleID, uint32_t level, uint32_t,
                        zel_Log **log) {
  return host::logOpen(name, moduleID, level, log);
}

void Tolm_LogCleanup(zel_Log **log) {
  host::logClose(log);
}

void zel_LogLevel(uint32_t urgency, zel_Log *log, int32_t level, const char *format, ...) {
  if (level > host::logLevel(log)) return;
  va_list arguments;
  va_start(arguments, format);
  host::logVWrite(urgency, log, format, arguments);
  va_end(arguments);
}

void zel_LogNoLevel(uint32_t urgency, const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  host::logVWrite(urgency, nullptr, format, arguments);
  va_end(arguments);
}

const char *zel_LogGetName(zel_Log *log) {
  return host::logName(log);
}

int32_t zel_LogGetCurrentLogLevel(zel_Log *log) {
  return host::logLevel(log);
}

void zel_PanicWithModuleID(zel_ModuleID moduleID, const char *format, ...) {
  va_list arguments;
  va_start(arguments, format);
  host::panicInModule(moduleID, format, arguments);
}

/* ---- This host ------------------------------------------------------------------------------- */

uint64_t tolmapi_GetReturnAddress(uint32_t frame) {
  /* The frame's first word is the frame pointer of the function that asks. */
  const void *const callersFrame = *static_cast<void *const *>(__builtin_frame_address(0));
  return host::returnAddressOf(callersFrame, frame);
}

bool TOLM_IsWitnessNode(void) {
  return Kernel::current().settings().witness;
}

uint32_t QXT_GetMaxAssocCount(void) {
  return Kernel::current().settings().maxAssociations;
}

/* ---- Directory ------------------------------------------------------------------------------- */

zel_Status KARST_RegisterStatusCallback(KarstStatusFn fn, void *data) {
  return Kernel::current().directory().registerStatus(fn, data);
}

void KARST_DeregisterStatusCallback(KarstStatusFn fn, void *data) {
  Kernel::current().directory().deregisterStatus(fn, data);
}

void KARST_GetSelfUUID(zel_UUID *uuid) {
  *uuid = Kernel::current().directory().self();
}

zel_Status KARST_Subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  return Kernel::current().directory().subscribe(query, fn, data);
}

void KARST_Unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  Kernel::current().directory().unsubscribe(query, fn, data);
}

zel_Status KARST_FindEntry(const KarstQuery *query, uint32_t next, KarstEntryHeader *header,
                           uint32_t size) {
  if (size != sizeof *header) return ZEL_BAD_PARAM;
  return Kernel::current().directory().findEntry(*query, next, header);
}

zel_Status KARST_FindFullEntryByQuery(const KarstQuery *query, uint32_t flags,
                                      const ExprMshAllocator *allocator, KarstFullEntry **entry) {
  if (flags != 0) return ZEL_BAD_PARAM;
  return Kernel::current().directory().findFullEntry(*query, *allocator, entry);
}

zel_Status KARST_FindFullEntryByHeader(const KarstEntryHeader *header, uint32_t flags,
                                       const ExprMshAllocator *allocator, uint32_t present,
                                       KarstFullEntry **entry) {
  if (flags != 0 || present != 1) return ZEL_BAD_PARAM;
  return Kernel::current().directory().findFullEntry(*header, *allocator, entry);
}

/* ---- All of them ----------------------------------------------------------------------------- */

/* One function of each source file that defines some; static libraries give whole files. */
void host::linkPlatform() {
  [[maybe_unused]] static const void *volatile anchor;
  for (const void *function : {
           reinterpret_cast<const void *>(&zel_LockDomainCreate),
           reinterpret_cast<const void *>(&zel_SpinlockLock),
           reinterpret_cast<const void *>(&zel_GetTimerCycles),
           reinterpret_cast<const void *>(&zel_WorldWait),
           reinterpret_cast<const void *>(&TOLM_WorldCreate),
           reinterpret_cast<const void *>(&tolmapi_PreemptionIsPending),
           reinterpret_cast<const void *>(&tolmapi_GetPCPUNumPreemptible),
           reinterpret_cast<const void *>(&ExprMsh_UmshSingleStructure),
           reinterpret_cast<const void *>(&ExprMsh_UmshNetInterfaceEntry),
           reinterpret_cast<const void *>(&ExprMsh_UmshNetInterfaceEntryIpAddresses),
           reinterpret_cast<const void *>(&Trace_ClassLevelGet),
           reinterpret_cast<const void *>(&TokenBucket_UseTokens),
           static_cast<const void *>(&traceStreamTables),
           static_cast<const void *>(&perTraceTbConfig),
       }) {
    anchor = function;
  }
}
