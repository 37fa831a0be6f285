// Codeset conversion handles of the utility layer, built on the system's
// iconv, and the settings that say how UTF-8 is treated.
//
// Settings (read from the environment at each call; the ACL library asks
// once per direction, when it opens its handles):
//   RYACL_UTF8_ASSUMED=1      treat the local codeset as UTF-8 whatever the
//                             locale says
//   RYACL_UTF8_NOT_MODIFIED=1 UTF-8 is standard UTF-8 (never the modified
//                             form with C0 80 for NUL or surrogate pairs)
//   RYACL_UTF8_BMP_ONLY=1     refuse characters outside the Basic
//                             Multilingual Plane on the UTF-8 side
// Any value other than empty or "0" turns a setting on.
#include <errno.h>
#include <iconv.h>
#include <pthread.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_alloc.h"

struct zo_iconv_s {
    // One iconv_t carries shift state and is not safe for two threads at
    // once.  A mutex held for the span of one conversion is the simple safe
    // choice: opening an iconv_t per call would load and search the
    // converter tables on every conversion, and the texts converted here
    // (mechanisms, identities) are short, so the lock is held briefly.
    pthread_mutex_t lock;
    iconv_t cd;
    uint32_t flags;
};

namespace {

bool setting_on(const char *name) {
    const char *v = std::getenv(name);
    return v && *v && std::strcmp(v, "0") != 0;
}

// A four-byte UTF-8 sequence (lead byte F0..F4) is the only way to write a
// character beyond U+FFFF in valid UTF-8.
bool beyond_bmp(const char *s, size_t n) {
    for (size_t i = 0; i < n; ++i)
        if (static_cast<unsigned char>(s[i]) >= 0xF0) return true;
    return false;
}

}  // namespace

int zo_utf8_is_assumed_1(void) { return setting_on("RYACL_UTF8_ASSUMED"); }
int zo_utf8_is_not_modified_1(void) { return setting_on("RYACL_UTF8_NOT_MODIFIED"); }
int zo_utf8_is_limited_to_bmp_1(void) { return setting_on("RYACL_UTF8_BMP_ONLY"); }

// ZO_ICONV_UTF8_NOT_MODIFIED needs no work here: glibc's UTF-8 converter
// reads and writes standard UTF-8 only, so the setting already holds.
int zo_iconv_open_1(const char *codeset, uint32_t flags, zo_iconv_t *handle) {
    if (!handle) return ZO_ICONV_RC_BAD_ARGS;
    *handle = nullptr;
    if (!codeset || !*codeset) return ZO_ICONV_RC_BAD_ARGS;
    const bool from_utf8 = (flags & ZO_ICONV_FROM_UTF8) != 0;
    iconv_t cd = from_utf8 ? iconv_open(codeset, "UTF-8") : iconv_open("UTF-8", codeset);
    if (cd == reinterpret_cast<iconv_t>(-1)) return ZO_ICONV_RC_INVALID;
    // The handle is library state, so it comes from the library's allocator
    // like everything else it keeps.
    auto *h = static_cast<zo_iconv_s *>(acl__malloc(sizeof(zo_iconv_s)));
    if (!h) {
        iconv_close(cd);
        return ZO_ICONV_RC_NO_MEMORY;
    }
    if (pthread_mutex_init(&h->lock, nullptr) != 0) {
        iconv_close(cd);
        std::free(h);
        return ZO_ICONV_RC_BAD_HANDLE;
    }
    h->cd = cd;
    h->flags = flags;
    *handle = h;
    return 0;
}

namespace {

// Convert all of `in` into a fresh block; the block always has a NUL after
// the converted bytes, so the result is terminated even when the input
// length did not include one.  Runs with the handle's lock held.
int convert_locked(zo_iconv_s *h, const char *in, size_t inlen, char **out, size_t *outlen) {
    size_t cap = inlen > (SIZE_MAX - 16) / 2 ? SIZE_MAX : inlen * 2 + 16;
    char *buf = static_cast<char *>(acl__malloc(cap));
    if (!buf) {
        *outlen = cap;
        return ZO_ICONV_RC_NO_MEMORY;
    }
    iconv(h->cd, nullptr, nullptr, nullptr, nullptr);  // start from the initial shift state
    char *src = const_cast<char *>(in);
    size_t left = inlen;
    size_t used = 0;
    bool flushing = false;  // after the input, emit any closing shift sequence
    for (;;) {
        char *dst = buf + used;
        size_t room = cap - used - 1;  // keep one byte for the terminating NUL
        size_t r = flushing ? iconv(h->cd, nullptr, nullptr, &dst, &room)
                            : iconv(h->cd, &src, &left, &dst, &room);
        int err = errno;
        used = static_cast<size_t>(dst - buf);
        if (r != static_cast<size_t>(-1)) {
            if (flushing) break;
            flushing = true;
            continue;
        }
        if (err != E2BIG) {
            std::free(buf);
            return (err == EILSEQ || err == EINVAL) ? ZO_ICONV_RC_INVALID : ZO_ICONV_RC_BAD_HANDLE;
        }
        if (cap > SIZE_MAX / 2) {
            std::free(buf);
            *outlen = SIZE_MAX;
            return ZO_ICONV_RC_NO_MEMORY;
        }
        char *grown = static_cast<char *>(acl__realloc(buf, cap * 2));
        if (!grown) {
            std::free(buf);
            *outlen = cap * 2;
            return ZO_ICONV_RC_NO_MEMORY;
        }
        buf = grown;
        cap *= 2;
    }
    buf[used] = '\0';
    *out = buf;
    *outlen = used;
    return 0;
}

}  // namespace

// Only the allocating form is offered (*out null, *outlen 0): every caller
// in this system asks for it, and a caller-sized area is refused outright
// rather than half supported.  *inlen is left as it was.  When memory runs
// out, *outlen tells the size that could not be allocated.
int zo_iconv_str_1(zo_iconv_t handle, uint32_t options, const char *in, size_t *inlen, char **out,
                   size_t *outlen) {
    (void)options;  // no options are defined
    if (!handle) return ZO_ICONV_RC_BAD_HANDLE;
    if (!in || !inlen || !out || !outlen || *out || *outlen != 0) return ZO_ICONV_RC_BAD_ARGS;
    const bool bmp_only = (handle->flags & ZO_ICONV_UTF8_BMP_ONLY) != 0;
    const bool from_utf8 = (handle->flags & ZO_ICONV_FROM_UTF8) != 0;
    if (bmp_only && from_utf8 && beyond_bmp(in, *inlen)) return ZO_ICONV_RC_INVALID;

    char *res = nullptr;
    size_t reslen = 0;
    if (pthread_mutex_lock(&handle->lock) != 0) return ZO_ICONV_RC_BAD_HANDLE;
    int rc = convert_locked(handle, in, *inlen, &res, &reslen);
    pthread_mutex_unlock(&handle->lock);
    if (rc != 0) {
        if (rc == ZO_ICONV_RC_NO_MEMORY) *outlen = reslen;
        return rc;
    }
    if (bmp_only && !from_utf8 && beyond_bmp(res, reslen)) {
        std::free(res);
        return ZO_ICONV_RC_INVALID;
    }
    *out = res;
    *outlen = reslen;
    return 0;
}
