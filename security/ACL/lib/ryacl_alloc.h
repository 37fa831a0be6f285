// The library's one allocation path.  Every heap block the library makes goes
// through these, so tests can fail any one allocation in turn.
#pragma once

#include <cstddef>
#include <cstdint>

void *acl__malloc(size_t n);
void *acl__calloc(size_t count, size_t size);
void *acl__realloc(void *p, size_t n);
char *acl__strdup(const char *s);
char *acl__strndup(const char *s, size_t n);

// Record that `fn` could not allocate n bytes: ACL_RC_NO_MEMORY with message
// 89 (NO_MEMORY), n capped at INT32_MAX as the message's number holds no
// more.  Returns ACL_RC_NO_MEMORY, for `return acl__no_memory(...)`.
int32_t acl__no_memory(const char *fn, size_t n);
// n bytes through acl__malloc; on failure acl__no_memory(fn, n) and null.
void *acl__malloc_or_record(const char *fn, size_t n);

// Test seam: when set, every allocation first asks the hook; a false answer
// makes that allocation fail.  Null restores plain allocation.  Not exported
// from the shared library; tests link the static one.
typedef bool (*acl__alloc_hook_t)(size_t n);
void acl__set_alloc_hook(acl__alloc_hook_t hook);
