/* The platform's functions that the directory and the tracing room define themselves. In the copies
 * of their libraries that the simulator links they are named host_... (see CMakeLists.txt), and
 * what modules find under the platform's name is here: like every other call a point of the
 * scheduler, in the history, and able to fail. No lock.
 */
#include "platform/expr_msh.h"
#include "platform/tracing.h"
#include "sim/access/access.h"
#include "sim/observer.h"
#include "sim/platform_call.h"

using namespace sim;

/* Decoding has written the fields of the table. A nested one reaches up to the next row's. */
static void noteFields(const ExprMshField *table, void *record) {
  auto *bytes = static_cast<uint8_t *>(record);
  for (const ExprMshField *field = table; field->name; ++field) {
    size_t size = 0;
    switch (field->type) {
      case EXPR_MSH_U64:
        size = 8;
        break;
      case EXPR_MSH_U32:
        size = 4;
        break;
      case EXPR_MSH_ADDRESS:
        size = 16;
        break;
      case EXPR_MSH_MAC:
        size = 6;
        break;
      default:
        if (field[1].name) size = field[1].offset - field->offset;
    }
    access::noteWrite(bytes + field->offset, size);
  }
}

extern "C" {

decltype(ExprMsh_UmshSingleStructure) host_ExprMsh_UmshSingleStructure;
decltype(Trace_ClassLevelGet) host_Trace_ClassLevelGet;
decltype(Trace_GetPerTraceThrottledTraceId) host_Trace_GetPerTraceThrottledTraceId;
decltype(Trace_GetGlobalThrottledTraceId) host_Trace_GetGlobalThrottledTraceId;
decltype(Trace_CreateWallClockEntry) host_Trace_CreateWallClockEntry;
decltype(Trace_Notify) host_Trace_Notify;
decltype(TokenBucket_InitMini) host_TokenBucket_InitMini;
decltype(TokenBucket_UseTokensMini) host_TokenBucket_UseTokensMini;
decltype(TokenBucket_UseTokens) host_TokenBucket_UseTokens;
decltype(TokenBucket_TimeToGetTokens) host_TokenBucket_TimeToGetTokens;

zel_Status ExprMsh_UmshSingleStructure(const ExprMshAllocator *allocator, const ExprMshField *table,
                                       const void *data, uint32_t length, const char *name,
                                       void *record) {
  PlatformCall call(Call::ExprMsh_UmshSingleStructure, Argument::text(name));
  access::noteRead(data, length);
  zel_Status status = call.fault();
  if (status == ZEL_OK)
    status = call.returns(
        host_ExprMsh_UmshSingleStructure(allocator, table, data, length, name, record));
  noteFields(table, record);
  if (Observer *observer = call.machine().observer())
    observer->decoded(call.fiber(), name, status, record);
  return status;
}

int32_t Trace_ClassLevelGet(uint32_t traceClass) {
  PlatformCall call(Call::Trace_ClassLevelGet, Argument::number(traceClass));
  return call.returns(host_Trace_ClassLevelGet(traceClass));
}

uint32_t Trace_GetPerTraceThrottledTraceId(void) {
  PlatformCall call(Call::Trace_GetPerTraceThrottledTraceId);
  return call.returns(host_Trace_GetPerTraceThrottledTraceId());
}

uint32_t Trace_GetGlobalThrottledTraceId(void) {
  PlatformCall call(Call::Trace_GetGlobalThrottledTraceId);
  return call.returns(host_Trace_GetGlobalThrottledTraceId());
}

void Trace_CreateWallClockEntry(void *stream, TraceRecord *record) {
  PlatformCall call(Call::Trace_CreateWallClockEntry);
  host_Trace_CreateWallClockEntry(stream, record);
}

void Trace_Notify(uint64_t handle) {
  PlatformCall call(Call::Trace_Notify);
  host_Trace_Notify(handle);
}

void TokenBucket_InitMini(TokenBucketMini *bucket, const void *config) {
  PlatformCall call(Call::TokenBucket_InitMini);
  access::noteWrite(bucket, sizeof *bucket);
  host_TokenBucket_InitMini(bucket, config);
}

bool TokenBucket_UseTokensMini(TokenBucketMini *bucket, const void *config, uint64_t tokens,
                               uint64_t *out) {
  PlatformCall call(Call::TokenBucket_UseTokensMini, Argument::number(tokens));
  access::noteAtomicUpdate(bucket->opaque, sizeof bucket->opaque[0], __ATOMIC_RELAXED);
  access::noteWrite(out, sizeof *out);
  return call.returns(host_TokenBucket_UseTokensMini(bucket, config, tokens, out));
}

bool TokenBucket_UseTokens(TokenBucket *bucket, uint64_t tokens, uint64_t *out) {
  PlatformCall call(Call::TokenBucket_UseTokens, Argument::number(tokens));
  access::noteWrite(out, sizeof *out);
  return call.returns(host_TokenBucket_UseTokens(bucket, tokens, out));
}

uint64_t TokenBucket_TimeToGetTokens(void *bucket) {
  PlatformCall call(Call::TokenBucket_TimeToGetTokens);
  return call.returns(host_TokenBucket_TimeToGetTokens(bucket));
}

}  // extern "C"
