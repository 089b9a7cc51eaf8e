/* The reliable datagram transport, as far as modules size their heaps by it. */
#ifndef PLATFORM_QXT_H
#define PLATFORM_QXT_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Largest number of associations that the transport keeps at a time. Blocks: no. Under a spinlock:
 * yes. */
uint32_t QXT_GetMaxAssocCount(void);

#ifdef __cplusplus
}
#endif

#endif
