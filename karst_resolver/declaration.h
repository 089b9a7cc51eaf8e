/* The module's parameter, which the loader may set before it calls init_module. */
#ifndef KARST_RESOLVER_DECLARATION_H
#define KARST_RESOLVER_DECLARATION_H

#include <stdint.h>

extern "C" {

/* Lower bound of the module heap's maximum size, in bytes; a negative value counts as a very large
 * one. */
extern int32_t KARST_RESOLVER_LEAST_MAX_HEAP;

} /* extern "C" */

#endif
