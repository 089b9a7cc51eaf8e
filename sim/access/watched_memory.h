/* Included before every file of a watched module: what the compiler would expand into instructions
 * of its own becomes a call that is seen (instrumentation.cpp). No lock.
 */
#pragma once

#include <stddef.h>

/* The linker's names and the compiler's. NOLINTBEGIN(bugprone-reserved-identifier) */
extern "C" {
void *__wrap_memcpy(void *to, const void *from, size_t size);
void *__wrap_memset(void *memory, int value, size_t size);
int __wrap_memcmp(const void *a, const void *b, size_t size);
}

#define __builtin_memcpy __wrap_memcpy
#define __builtin_memset __wrap_memset
#define __builtin_memcmp __wrap_memcmp
/* NOLINTEND(bugprone-reserved-identifier) */
