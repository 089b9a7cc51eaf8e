/* What the host kernel promises to its modules: identity, heaps, lock domains, spinlocks, names,
 * text, log, worlds, time, panic.
 *
 * Plain C. Every function has C linkage and follows the x86-64 System V calling convention; a
 * structure's layout is part of the binary contract and is asserted here.
 *
 * Two remarks stand with every function:
 *   blocks: may the call put the calling thread to sleep?
 *   under a spinlock: may a spinlock be held by the caller?
 */
#ifndef PLATFORM_ZEL_H
#define PLATFORM_ZEL_H

#include <stdbool.h>
#include <stddef.h>
#include <stdint.h>

#ifdef __cplusplus
#define ZEL_STATIC_ASSERT(condition, text) static_assert(condition, text)
extern "C" {
#else
#define ZEL_STATIC_ASSERT(condition, text) _Static_assert(condition, text)
#endif

#if defined(__GNUC__)
#define ZEL_PRINTF(formatIndex, firstArgument) \
  __attribute__((format(printf, formatIndex, firstArgument)))
#define ZEL_NORETURN __attribute__((noreturn))
#else
#define ZEL_PRINTF(formatIndex, firstArgument)
#define ZEL_NORETURN
#endif

/* ---- Status ---------------------------------------------------------------------------------- */

typedef uint32_t zel_Status;

#define ZEL_OK 0u                       /* success; in a subscription: the entry is present */
#define ZEL_FAILURE 0x0bad0001u         /* generic failure */
#define ZEL_NOT_FOUND 0x0bad0003u       /* no such entry; in a subscription: entry removed */
#define ZEL_BAD_PARAM 0x0bad0007u       /* an argument is not acceptable */
#define ZEL_NO_MEMORY 0x0bad0014u       /* an allocation failed */
#define ZEL_SUB_OVERFLOW 0x0bad002fu    /* in a subscription: changes were lost, rescan */
#define ZEL_SUB_CANCELLED 0x0bad0030u   /* in a subscription: its final call */
#define ZEL_NOT_INITIALIZED 0x0bad0031u /* the service asked does not exist (yet) */
#define ZEL_WORLD_STOPPING 0x0bad0069u  /* a wait ends because the world is being stopped */
#define ZEL_SUB_RESYNC 0x0bad0113u      /* in a subscription: start over, rescan */

/* Text of a status, such as "ZEL_NO_MEMORY"; never null, valid for ever. A value that nobody knows
 * reads "unknown status". Blocks: no. Under a spinlock: yes. */
const char *zel_StatusToString(zel_Status status);

/* ---- Identity, names, text ------------------------------------------------------------------- */

typedef uint32_t zel_ModuleID;
#define ZEL_NO_MODULE 0xffffffffu

/* The module whose init_module runs (afterwards: the module that was loaded last). A module reads
 * it in init_module and keeps the value. */
extern zel_ModuleID zel_ModuleCurrentID;

/* 16 bytes, passed by value in two integer registers. All zero stands for "none". Printed as
 * 8-4-4-4-12 hexadecimal digits over bytes 0 to 15 in order. */
typedef struct zel_UUID {
  uint8_t bytes[16];
} zel_UUID;
ZEL_STATIC_ASSERT(sizeof(zel_UUID) == 16, "a UUID is 16 bytes");

/* Up to 31 characters and a NUL. */
typedef struct zel_Name {
  char text[32];
} zel_Name;
ZEL_STATIC_ASSERT(sizeof(zel_Name) == 32, "a name is 32 bytes");

/* Fills `name` with `text`, cut to 31 characters, and zeroes the rest. Blocks: no. Under a
 * spinlock: yes. */
void zel_NameInitialize(zel_Name *name, const char *text);

/* C99 snprintf: writes at most `size` bytes with the NUL and returns the length that the whole
 * text has. Blocks: no. Under a spinlock: yes. */
int zel_Snprintf(char *buffer, size_t size, const char *format, ...) ZEL_PRINTF(3, 4);

/* ---- Heaps ----------------------------------------------------------------------------------- */

typedef uint64_t zel_HeapID;
#define ZEL_NO_HEAP 0ull

typedef struct zel_HeapProps {
  uint32_t type;         /* 0: grows on demand from initialSize to maximumSize */
  zel_Name name;         /* shown in reports */
  zel_ModuleID moduleID; /* owner */
  uint32_t initialSize;  /* bytes reserved at creation */
  uint32_t maximumSize;  /* bytes; what the heap's blocks consume never exceeds it */
  uint32_t reserved;     /* 0 */
} zel_HeapProps;
ZEL_STATIC_ASSERT(sizeof(zel_HeapProps) == 52, "layout of the heap properties");
ZEL_STATIC_ASSERT(offsetof(zel_HeapProps, name) == 4, "layout of the heap properties");
ZEL_STATIC_ASSERT(offsetof(zel_HeapProps, moduleID) == 36, "layout of the heap properties");
ZEL_STATIC_ASSERT(offsetof(zel_HeapProps, initialSize) == 40, "layout of the heap properties");
ZEL_STATIC_ASSERT(offsetof(zel_HeapProps, maximumSize) == 44, "layout of the heap properties");
ZEL_STATIC_ASSERT(offsetof(zel_HeapProps, reserved) == 48, "layout of the heap properties");

/* Creates a heap and stores its ID, which is never ZEL_NO_HEAP. ZEL_OK; ZEL_BAD_PARAM (initial
 * size above the maximum, maximum zero); ZEL_NO_MEMORY. Blocks: yes. Under a spinlock: no. */
zel_Status zel_HeapCreate(const zel_HeapProps *props, zel_HeapID *heap);

/* Ends a heap. Blocks that are still alive are reported, each with its size and the code that
 * asked for it, and released. Blocks: yes. Under a spinlock: no. */
void zel_HeapDestroy(zel_HeapID heap);

/* `size` bytes from the heap, aligned to 16, contents undefined; null when the heap's maximum
 * would be exceeded. `returnAddress` is remembered as the code that asked. Blocks: no. Under a
 * spinlock: yes. */
void *zel_HeapAllocWithRA(zel_HeapID heap, uint32_t size, void *returnAddress);

/* Gives a block of `heap` back. A null block is ignored; a block that is not alive in this heap
 * stops the system. Blocks: no. Under a spinlock: yes. */
void zel_HeapFree(zel_HeapID heap, void *block);

/* ---- Lock domains and spinlocks -------------------------------------------------------------- */

typedef uint64_t zel_LockDomainID;
#define ZEL_NO_LOCK_DOMAIN 0xffffffffffffffffull

typedef uint64_t zel_SpinlockHandle;
#define ZEL_NO_SPINLOCK 0xffffffffffffffffull

#define ZEL_SPINLOCK_RANKED 1u /* the lock type whose rank is checked */

typedef struct zel_SpinlockProps {
  zel_ModuleID moduleID;
  zel_HeapID heap; /* the lock's memory comes from here */
  zel_Name name;   /* shown in reports */
  uint8_t type;    /* ZEL_SPINLOCK_RANKED */
  zel_LockDomainID domain;
  uint16_t rank; /* a lock may be taken only while every lock held has a smaller rank */
} zel_SpinlockProps;
ZEL_STATIC_ASSERT(sizeof(zel_SpinlockProps) == 72, "layout of the spinlock properties");
ZEL_STATIC_ASSERT(offsetof(zel_SpinlockProps, heap) == 8, "layout of the spinlock properties");
ZEL_STATIC_ASSERT(offsetof(zel_SpinlockProps, name) == 16, "layout of the spinlock properties");
ZEL_STATIC_ASSERT(offsetof(zel_SpinlockProps, type) == 48, "layout of the spinlock properties");
ZEL_STATIC_ASSERT(offsetof(zel_SpinlockProps, domain) == 56, "layout of the spinlock properties");
ZEL_STATIC_ASSERT(offsetof(zel_SpinlockProps, rank) == 64, "layout of the spinlock properties");

/* Creates a lock domain, which owns the locks created in it; `name` is a zel_Name. ZEL_OK or
 * ZEL_NO_MEMORY. Blocks: yes. Under a spinlock: no. */
zel_Status zel_LockDomainCreate(zel_ModuleID moduleID, zel_HeapID heap, const zel_Name *name,
                                zel_LockDomainID *domain);

/* Ends a domain; locks that were not destroyed are reported by name. Blocks: yes. Under a
 * spinlock: no. */
void zel_LockDomainDestroy(zel_LockDomainID domain);

/* Heap space, in bytes, that one lock of this type consumes. Blocks: no. Under a spinlock: yes. */
uint32_t zel_SpinlockAllocSize(uint32_t type);

/* Creates a lock and stores its handle, which is never ZEL_NO_SPINLOCK. ZEL_OK; ZEL_BAD_PARAM
 * (unknown type, heap or domain); ZEL_NO_MEMORY. Blocks: no. Under a spinlock: yes. */
zel_Status zel_SpinlockCreate(const zel_SpinlockProps *props, zel_SpinlockHandle *lock);

/* Ends a lock that nobody holds; a lock that is held stops the system. Returns only when the last
 * holder has left zel_SpinlockUnlock. Blocks: no. Under another spinlock: yes. */
void zel_SpinlockDestroy(zel_SpinlockHandle lock);

/* Takes and gives back the lock. Stops the system, naming the locks, on recursion, on a rank that
 * is not above every rank held, and on an unlock by a thread that does not hold it. What happened
 * before an unlock is visible after the next lock. Blocks: may spin and yield, never sleeps for an
 * event. Under another spinlock: yes, in rank order. */
void zel_SpinlockLock(zel_SpinlockHandle lock);
void zel_SpinlockUnlock(zel_SpinlockHandle lock);

/* ---- Log ------------------------------------------------------------------------------------- */

/* A module's log, opened with Tolm_LogInit (tolm.h). Opaque. */
typedef struct zel_Log zel_Log;

#define ZEL_LOG_URGENCY_INFO 1u
#define ZEL_LOG_URGENCY_WARNING 2u

/* Writes one line to `log`. `urgency` says how bad it is; the line appears when `level` is at most
 * the log's current level. Texts end in a newline. Blocks: no. Under a spinlock: yes. */
void zel_LogLevel(uint32_t urgency, zel_Log *log, int32_t level, const char *format, ...)
    ZEL_PRINTF(4, 5);

/* The same before a log exists; always appears. Blocks: no. Under a spinlock: yes. */
void zel_LogNoLevel(uint32_t urgency, const char *format, ...) ZEL_PRINTF(2, 3);

/* The name that the log was opened with, and its current level. Blocks: no. Under a spinlock:
 * yes. */
const char *zel_LogGetName(zel_Log *log);
int32_t zel_LogGetCurrentLogLevel(zel_Log *log);

/* ---- Worlds ---------------------------------------------------------------------------------- */

/* A world is a kernel thread, created with TOLM_WorldCreate (tolm.h). */
typedef uint32_t zel_WorldID;
#define ZEL_NO_WORLD 0u

#define ZEL_TIMEOUT_NONE 0xffffffffu

/* Puts the calling world to sleep until it is woken or stopped. `event` 0 and `lock`
 * ZEL_NO_SPINLOCK are the only ones served; `timeout` is in milliseconds or ZEL_TIMEOUT_NONE;
 * `reason` is shown in reports. ZEL_OK when woken (also when the wake-up came before the wait: it
 * is kept until the next wait and then used up) or timed out; ZEL_WORLD_STOPPING when
 * TOLM_WorldDestroy has been called for this world, now or before. Blocks: yes. Under a spinlock:
 * no, it stops the system. */
zel_Status zel_WorldWait(uint64_t event, zel_SpinlockHandle lock, uint32_t timeout,
                         const char *reason);

/* Wakes a world from its wait, or lets its next wait return at once. A world that does not exist
 * (ZEL_NO_WORLD, ended) is ignored. What happened before is visible to the woken world. Blocks:
 * no. Under a spinlock: yes. */
void zel_WorldForceWakeup(zel_WorldID world);

/* Sleeps for a time in microseconds. Blocks: yes. Under a spinlock: no, it stops the system. */
void zel_WorldSleep(uint32_t microseconds);

/* ---- Time, panic ----------------------------------------------------------------------------- */

/* The timer counter, which never runs backwards, and its value in nanoseconds. Blocks: no. Under a
 * spinlock: yes. */
uint64_t zel_GetTimerCycles(void);
uint64_t zel_TimerTCToNS(uint64_t cycles);

/* Stops the system with a message attributed to the module. Does not return. */
void zel_PanicWithModuleID(zel_ModuleID moduleID, const char *format, ...)
    ZEL_PRINTF(2, 3) ZEL_NORETURN;

#ifdef __cplusplus
}
#endif

#endif
