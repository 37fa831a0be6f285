// The library's one allocation path.  Every heap block the library makes goes
// through these, so tests can fail any one allocation in turn.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>

void *acl__malloc(size_t n);
void *acl__calloc(size_t count, size_t size);
void *acl__realloc(void *p, size_t n);
// n bytes aligned to `align` (a power of two), released with free.
void *acl__malloc_aligned(size_t align, size_t n);
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

// Advise the kernel that a large block is worth backing with huge pages
// (no effect on small blocks or where unsupported).
void acl__advise_large(void *p, size_t n);

// Many small blocks released together (the trees of one ACL under
// construction): handed out from large chunks, never freed one by one, so
// a file of a hundred thousand small sub-ACLs costs neither a heap call per
// block nor a heap walk at the end.  Blocks are 16-byte aligned.
struct acl__pool {
    void *chunks = nullptr;  // the latest chunk; each begins with a link to the one before
    char *at = nullptr;
    char *end = nullptr;
    size_t next_size = 0;
};
// Blocks larger than this are not worth pooling: callers take them from
// the heap, where they can grow in place.
constexpr size_t acl__pool_max_block = 4096;
// n bytes (at most acl__pool_max_block) from the pool, aligned to `align`
// (16 or 64: a block that starts a cache line spans the fewest); null when
// a chunk cannot be had (nothing recorded).
void *acl__pool_alloc(acl__pool *pool, size_t n, size_t align = 16);
// Release every chunk; the pool is empty and usable again.
void acl__pool_release(acl__pool *pool);

// Grow the array *p of capacity *cap to hold `need` elements (doubling,
// fourfold from 4 MiB), the capacity staying within 32 bits.  False when
// that cannot be had: *failed is then the size that could not be allocated
// (SIZE_MAX for one beyond reach) and the array is unchanged.
template <class T>
bool acl__grow(T **p, uint32_t *cap, size_t need, size_t *failed) {
    if (need <= *cap) return true;
    size_t nc = *cap ? *cap : 4;
    // From 4 MiB on, fourfold: each move copies the array into fresh pages,
    // which cost more than address space never touched.
    const size_t factor = nc * sizeof(T) >= (size_t{4} << 20) ? 4 : 2;
    while (nc < need) nc = nc > SIZE_MAX / factor ? SIZE_MAX : nc * factor;
    if (nc > UINT32_MAX) nc = UINT32_MAX;
    if (nc < need || nc > SIZE_MAX / sizeof(T)) {
        *failed = SIZE_MAX;
        return false;
    }
    // A large array is moved by hand into a block advised before the copy:
    // realloc would fill the new block's pages 4 KiB at a time first.
    const bool large = nc * sizeof(T) >= (size_t{4} << 20);
    void *q = large ? acl__malloc(nc * sizeof(T)) : acl__realloc(*p, nc * sizeof(T));
    if (!q) {
        *failed = nc * sizeof(T);
        return false;
    }
    if (large) {
        acl__advise_large(q, nc * sizeof(T));
        if (*p) std::memcpy(q, *p, size_t{*cap} * sizeof(T));
        std::free(*p);
    }
    *p = static_cast<T *>(q);
    *cap = static_cast<uint32_t>(nc);
    if (!large) acl__advise_large(q, nc * sizeof(T));
    return true;
}
