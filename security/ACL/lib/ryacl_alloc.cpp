// The library's one allocation path (see ryacl_alloc.h).
#include "ryacl_alloc.h"

#include <sys/mman.h>

#include <atomic>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "ryacl.h"
#include "ryacl_error.h"

namespace {
std::atomic<acl__alloc_hook_t> g_hook{nullptr};

bool allowed(size_t n) {
    acl__alloc_hook_t h = g_hook.load(std::memory_order_acquire);
    return !h || h(n);
}
}  // namespace

void acl__set_alloc_hook(acl__alloc_hook_t hook) { g_hook.store(hook, std::memory_order_release); }

void *acl__malloc(size_t n) {
    if (!allowed(n)) return nullptr;
    return std::malloc(n ? n : 1);
}

void *acl__calloc(size_t count, size_t size) {
    if (size && count > SIZE_MAX / size) return nullptr;
    if (!allowed(count * size)) return nullptr;
    return std::calloc(count ? count : 1, size ? size : 1);
}

void *acl__malloc_aligned(size_t align, size_t n) {
    if (!allowed(n)) return nullptr;
    n = n ? (n + align - 1) / align * align : align;  // aligned_alloc wants a multiple
    return std::aligned_alloc(align, n);
}

void *acl__realloc(void *p, size_t n) {
    if (!allowed(n)) return nullptr;
    return std::realloc(p, n ? n : 1);
}

char *acl__strndup(const char *s, size_t n) {
    size_t len = strnlen(s, n);
    char *d = static_cast<char *>(acl__malloc(len + 1));
    if (!d) return nullptr;
    std::memcpy(d, s, len);
    d[len] = '\0';
    return d;
}

char *acl__strdup(const char *s) { return acl__strndup(s, SIZE_MAX); }

int32_t acl__no_memory(const char *fn, size_t n) {
    const int32_t size = n > INT32_MAX ? INT32_MAX : static_cast<int32_t>(n);
    return acl::set_error(ACL_RC_NO_MEMORY, acl::msg::NO_MEMORY, fn, size);
}

void *acl__malloc_or_record(const char *fn, size_t n) {
    void *p = acl__malloc(n);
    if (!p) acl__no_memory(fn, n);
    return p;
}

void acl__advise_large(void *p, size_t n) {
#ifdef MADV_HUGEPAGE
    // Arrays of a million entries are walked and probed at random: with 4 KiB
    // pages nearly every access is a TLB miss and every fresh page a fault.
    // Only whole 2 MiB stretches inside the block are advised; the advice
    // changes no content and a refusal is harmless.
    constexpr uintptr_t kHuge = uintptr_t{2} << 20;
    if (!p || n < kHuge) return;
    uintptr_t a = (reinterpret_cast<uintptr_t>(p) + kHuge - 1) & ~(kHuge - 1);
    uintptr_t e = (reinterpret_cast<uintptr_t>(p) + n) & ~(kHuge - 1);
    if (e > a) madvise(reinterpret_cast<void *>(a), e - a, MADV_HUGEPAGE);
#else
    (void)p;
    (void)n;
#endif
}

void *acl__pool_alloc(acl__pool *pool, size_t n, size_t align) {
    n = (n + 15) & ~size_t{15};
    const auto skip = [&] { return (align - reinterpret_cast<uintptr_t>(pool->at) % align) % align; };
    if (!pool->at || static_cast<size_t>(pool->end - pool->at) < n + skip()) {
        // Chunks double from 64 KiB to 4 MiB: a small ACL stays small, a
        // large one makes few chunks, advised into huge pages.
        constexpr size_t kFirst = size_t{64} << 10, kLast = size_t{4} << 20, kHead = 16, kHugeChunk = size_t{2} << 20;
        const size_t size = pool->next_size ? pool->next_size : kFirst;
        // A large chunk starts on a huge-page boundary, so that all of it
        // can be backed by huge pages: the trees in it are reached at random.
        char *c = static_cast<char *>(size >= kHugeChunk ? acl__malloc_aligned(kHugeChunk, size) : acl__malloc(size));
        if (!c) return nullptr;
        acl__advise_large(c, size);
        std::memcpy(c, &pool->chunks, sizeof pool->chunks);
        pool->chunks = c;
        pool->at = c + kHead;
        pool->end = c + size;
        pool->next_size = size < kLast ? size * 2 : kLast;
    }
    pool->at += skip();
    void *r = pool->at;
    pool->at += n;
    return r;
}

void acl__pool_release(acl__pool *pool) {
    while (pool->chunks) {
        void *prev;
        std::memcpy(&prev, pool->chunks, sizeof prev);
        std::free(pool->chunks);
        pool->chunks = prev;
    }
    *pool = acl__pool{};
}
