// The library's one allocation path.  Every heap block the library makes goes
// through these, so tests can fail any one allocation in turn.
#pragma once

#include <cstddef>

void *acl__malloc(size_t n);
void *acl__calloc(size_t count, size_t size);
void *acl__realloc(void *p, size_t n);
char *acl__strdup(const char *s);
char *acl__strndup(const char *s, size_t n);

// Test seam: when set, every allocation first asks the hook; a false answer
// makes that allocation fail.  Null restores plain allocation.  Not exported
// from the shared library; tests link the static one.
typedef bool (*acl__alloc_hook_t)(size_t n);
void acl__set_alloc_hook(acl__alloc_hook_t hook);
