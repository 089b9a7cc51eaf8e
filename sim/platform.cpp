/* The platform's functions that are no worlds or spinlocks: each stops at a point of the scheduler,
 * is written into the history, fails when it was asked to, and then does the host's own work.
 */
#include <algorithm>
#include <cstdarg>
#include <cstdio>

#include "host/directory/directory.h"
#include "host/directory/marshaller.h"
#include "host/kernel/frames.h"
#include "host/kernel/heap.h"
#include "host/kernel/log.h"
#include "host/kernel/panic.h"
#include "host/kernel/text.h"
#include "platform/karst_directory.h"
#include "platform/qxt.h"
#include "platform/tolm.h"
#include "sim/access/access.h"
#include "sim/observer.h"
#include "sim/platform_call.h"
#include "sim/simulation.h"

using namespace sim;

namespace {

constexpr size_t pointerSize = sizeof(void *);

host::Directory &directory() {
  return Simulation::current().directory();
}

Argument subjectOf(const KarstQuery &query) {
  return Argument::entry(query.type, query.uuid);
}

zel_UUID wantedBy(const KarstQuery &query) {
  return query.flags & KARST_QUERY_ALL ? zel_UUID{} : query.uuid;
}

void report(PlatformCall &call, const Lookup &lookup) {
  if (Observer *observer = call.machine().observer()) observer->lookedUp(call.fiber(), lookup);
}

/* The directory has stored a whole entry in a block of the caller's, and where that is. */
void noteWhole(KarstFullEntry *const *entry) {
  access::noteWrite(entry, pointerSize);
  access::noteWrite(*entry, sizeof **entry + (*entry)->header.dataLength);
}

}  // namespace

/* ---- Names, text ----------------------------------------------------------------------------- */

extern "C" const char *zel_StatusToString(zel_Status status) {
  PlatformCall call(Call::zel_StatusToString, Argument::number(status));
  return host::statusText(status);
}

extern "C" void zel_NameInitialize(zel_Name *name, const char *text) {
  PlatformCall call(Call::zel_NameInitialize, Argument::text(text));
  access::noteText(text);
  access::noteWrite(name, sizeof *name);
  host::fillName(name, text);
}

extern "C" int zel_Snprintf(char *buffer, size_t size, const char *format, ...) {
  PlatformCall call(Call::zel_Snprintf, Argument::number(size));
  va_list arguments;
  va_start(arguments, format);
  const int length = std::vsnprintf(buffer, size, format, arguments);
  va_end(arguments);
  access::noteText(format);
  if (length >= 0) access::noteWrite(buffer, std::min(size, static_cast<size_t>(length) + 1));
  return call.returns(length);
}

/* ---- Heaps ----------------------------------------------------------------------------------- */

extern "C" zel_Status zel_HeapCreate(const zel_HeapProps *props, zel_HeapID *heap) {
  PlatformCall call(Call::zel_HeapCreate, Argument::name(props->name));
  if (call.fault()) return call.fault();
  access::noteRead(props, sizeof *props);
  const zel_Status status = host::heapCreate(*props, heap);
  if (status == ZEL_OK) access::noteWrite(heap, sizeof *heap);
  return call.returns(status);
}

extern "C" void zel_HeapDestroy(zel_HeapID heap) {
  PlatformCall call(Call::zel_HeapDestroy);
  host::heapDestroy(heap);
}

extern "C" void *zel_HeapAllocWithRA(zel_HeapID heap, uint32_t size, void *returnAddress) {
  PlatformCall call(Call::zel_HeapAllocWithRA, Argument::number(size));
  if (call.fault()) return nullptr;
  void *block = host::heapAlloc(heap, size, returnAddress);
  call.returns(block ? ZEL_OK : ZEL_NO_MEMORY);
  return block;
}

extern "C" void zel_HeapFree(zel_HeapID heap, void *block) {
  PlatformCall call(Call::zel_HeapFree);
  host::heapFree(heap, block);
}

/* ---- Log, panic ------------------------------------------------------------------------------ */

extern "C" void zel_LogLevel(uint32_t urgency, zel_Log *log, int32_t level, const char *format,
                             ...) {
  PlatformCall call(Call::zel_LogLevel, Argument::text(format));
  if (level > host::logLevel(log)) return;
  va_list arguments;
  va_start(arguments, format);
  host::logVWrite(urgency, log, format, arguments);
  va_end(arguments);
}

extern "C" void zel_LogNoLevel(uint32_t urgency, const char *format, ...) {
  PlatformCall call(Call::zel_LogNoLevel, Argument::text(format));
  va_list arguments;
  va_start(arguments, format);
  host::logVWrite(urgency, nullptr, format, arguments);
  va_end(arguments);
}

extern "C" const char *zel_LogGetName(zel_Log *log) {
  PlatformCall call(Call::zel_LogGetName);
  return host::logName(log);
}

extern "C" int32_t zel_LogGetCurrentLogLevel(zel_Log *log) {
  PlatformCall call(Call::zel_LogGetCurrentLogLevel);
  return call.returns(host::logLevel(log));
}

extern "C" zel_Status Tolm_LogInit(const char *name, zel_ModuleID moduleID, uint32_t level,
                                   uint32_t, zel_Log **log) {
  PlatformCall call(Call::Tolm_LogInit, Argument::text(name));
  if (call.fault()) return call.fault();
  const zel_Status status = host::logOpen(name, moduleID, level, log);
  if (status == ZEL_OK) access::noteWrite(log, pointerSize);
  return call.returns(status);
}

extern "C" void Tolm_LogCleanup(zel_Log **log) {
  PlatformCall call(Call::Tolm_LogCleanup);
  access::noteWrite(log, pointerSize);
  host::logClose(log);
}

extern "C" void zel_PanicWithModuleID(zel_ModuleID moduleID, const char *format, ...) {
  PlatformCall call(Call::zel_PanicWithModuleID, Argument::text(format));
  va_list arguments;
  va_start(arguments, format);
  host::panicInModule(moduleID, format, arguments);
}

/* ---- Sizes, places, this host's role --------------------------------------------------------- */

extern "C" uint32_t tolmapi_HeapRequest2Size(uint32_t bytes) {
  PlatformCall call(Call::tolmapi_HeapRequest2Size, Argument::number(bytes));
  return call.returns(host::heapSpaceFor(bytes));
}

extern "C" uint32_t QXT_GetMaxAssocCount(void) {
  PlatformCall call(Call::QXT_GetMaxAssocCount);
  return call.returns(call.machine().settings().maxAssociations);
}

extern "C" uint64_t tolmapi_GetReturnAddress(uint32_t frame) {
  PlatformCall call(Call::tolmapi_GetReturnAddress, Argument::number(frame));
  /* Frame 0 is the caller's: the one that this function's own frame leads to. */
  return host::returnAddressOf(__builtin_frame_address(0), frame + 1, call.fiber().stackTop());
}

extern "C" bool TOLM_IsWitnessNode(void) {
  PlatformCall call(Call::TOLM_IsWitnessNode);
  return call.returns(call.machine().settings().witness);
}

/* ---- Directory, marshaller ------------------------------------------------------------------- */

extern "C" zel_Status KARST_RegisterStatusCallback(KarstStatusFn fn, void *data) {
  PlatformCall call(Call::KARST_RegisterStatusCallback);
  if (call.fault()) return call.fault();
  return call.returns(call.machine().callbacks().registerStatus(directory(), fn, data));
}

extern "C" void KARST_DeregisterStatusCallback(KarstStatusFn fn, void *data) {
  PlatformCall call(Call::KARST_DeregisterStatusCallback);
  call.machine().callbacks().deregisterStatus(directory(), fn, data);
}

extern "C" void KARST_GetSelfUUID(zel_UUID *uuid) {
  PlatformCall call(Call::KARST_GetSelfUUID);
  *uuid = directory().self();
  access::noteWrite(uuid, sizeof *uuid);
  if (Observer *observer = call.machine().observer()) observer->toldSelf(call.fiber(), *uuid);
}

extern "C" zel_Status KARST_Subscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  PlatformCall call(Call::KARST_Subscribe, subjectOf(*query));
  access::noteRead(query, sizeof *query);
  zel_Status status = call.fault();
  if (status == ZEL_OK)
    status = call.returns(call.machine().callbacks().subscribe(directory(), query, fn, data));
  if (Observer *observer = call.machine().observer())
    observer->subscribed(call.fiber(), *query, data, status);
  return status;
}

extern "C" void KARST_Unsubscribe(const KarstQuery *query, KarstSubscriptionFn fn, void *data) {
  PlatformCall call(Call::KARST_Unsubscribe, subjectOf(*query));
  access::noteRead(query, sizeof *query);
  call.machine().callbacks().unsubscribe(directory(), query, fn, data);
}

extern "C" zel_Status KARST_FindEntry(const KarstQuery *query, uint32_t next,
                                      KarstEntryHeader *header, uint32_t size) {
  PlatformCall call(Call::KARST_FindEntry, subjectOf(*query));
  access::noteRead(query, sizeof *query);
  if (next == 1) access::noteRead(header, sizeof *header);
  zel_Status status = call.fault();
  if (status == ZEL_OK)
    status = call.returns(size == sizeof *header ? directory().findEntry(*query, next, header)
                                                 : ZEL_BAD_PARAM);
  if (status == ZEL_OK) access::noteWrite(header, sizeof *header);
  report(call, {Call::KARST_FindEntry, query->type, wantedBy(*query), next, status,
                status == ZEL_OK ? header : nullptr});
  return status;
}

extern "C" zel_Status KARST_FindFullEntryByQuery(const KarstQuery *query, uint32_t,
                                                 const ExprMshAllocator *allocator,
                                                 KarstFullEntry **entry) {
  PlatformCall call(Call::KARST_FindFullEntryByQuery, subjectOf(*query));
  access::noteRead(query, sizeof *query);
  zel_Status status = call.fault();
  if (status == ZEL_OK) status = call.returns(directory().findFullEntry(*query, *allocator, entry));
  if (status == ZEL_OK) noteWhole(entry);
  report(call, {Call::KARST_FindFullEntryByQuery, query->type, wantedBy(*query), 0, status,
                status == ZEL_OK ? &(*entry)->header : nullptr});
  return status;
}

extern "C" zel_Status KARST_FindFullEntryByHeader(const KarstEntryHeader *header, uint32_t,
                                                  const ExprMshAllocator *allocator, uint32_t,
                                                  KarstFullEntry **entry) {
  PlatformCall call(Call::KARST_FindFullEntryByHeader, Argument::entry(0, header->uuid));
  access::noteRead(header, sizeof *header);
  zel_Status status = call.fault();
  if (status == ZEL_OK)
    status = call.returns(directory().findFullEntry(*header, *allocator, entry));
  if (status == ZEL_OK) noteWhole(entry);
  report(call, {Call::KARST_FindFullEntryByHeader, 0, header->uuid, 0, status,
                status == ZEL_OK ? &(*entry)->header : nullptr});
  return status;
}
