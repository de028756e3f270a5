// Allocator of the host's base library.
//
// Every block handed out by kelm_malloc, kelm_realloc or i_strdup is released
// with kelm_free, never with free or delete.  The functions sit over the C
// allocator; they are safe to call from any thread.
#ifndef FSCANNER_BASE_KELMEM_H
#define FSCANNER_BASE_KELMEM_H

#include <cstddef>

// Returns a block of at least size bytes (a zero size still gives a unique
// block), or null when the system is out of memory.  The caller owns it.
void* kelm_malloc(size_t size);

// Releases a block from kelm_malloc, kelm_realloc or i_strdup.  Null is allowed.
void kelm_free(void* block);

// Resizes a block as realloc does.  On failure the old block stays valid and
// null is returned.  A null block behaves as kelm_malloc.
void* kelm_realloc(void* block, size_t size);

// Copies a NUL-terminated text into a block from kelm_malloc.  Null gives null.
char* i_strdup(const char* text);

// Out-of-memory drill for tests.  After `allocations` more requests of
// kelm_malloc or kelm_realloc have been served, every further request fails
// (null, the old block of a realloc untouched) until the drill is ended by a
// negative value, which is also the default: never fail.  Process-wide.
void kelm_failAfter(long allocations);

#endif
