// Conversion of mechanisms and identities between the local codeset and
// UTF-8, through two handles opened once per process, one per direction.
#include <langinfo.h>
#include <pthread.h>

#include <atomic>
#include <cstdio>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_utils.h"
#include "ryacl_utils_codeset.h"

extern "C" {
// Absent until opened, and for good if opening failed: a codeset that
// cannot be converted now will not become convertible later.
zo_iconv_t acl__to_utf8_hdl = nullptr;
zo_iconv_t acl__from_utf8_hdl = nullptr;
pthread_once_t acl__init_to_utf8_once_block = PTHREAD_ONCE_INIT;
pthread_once_t acl__init_from_utf8_once_block = PTHREAD_ONCE_INIT;
}

namespace {

struct source_loc {
    const char *file;
    int line;
};

// Codeset names forced by tests, per direction (0 to UTF-8, 1 from UTF-8).
std::atomic<const char *> g_codeset_override[2] = {nullptr, nullptr};

void open_handle(uint32_t flags, zo_iconv_t *handle) {
    char codeset[256] = {};
    const char *forced = g_codeset_override[(flags & ZO_ICONV_FROM_UTF8) ? 1 : 0].load(std::memory_order_acquire);
    if (forced) {
        std::snprintf(codeset, sizeof codeset, "%s", forced);
    } else if (zo_utf8_is_assumed_1()) {
        std::snprintf(codeset, sizeof codeset, "%s", "UTF-8");
    } else {
        const char *cs = nl_langinfo(CODESET);
        std::snprintf(codeset, sizeof codeset, "%s", cs ? cs : "");
    }
    if (zo_utf8_is_not_modified_1()) flags |= ZO_ICONV_UTF8_NOT_MODIFIED;
    if (zo_utf8_is_limited_to_bmp_1()) flags |= ZO_ICONV_UTF8_BMP_ONLY;
    // The result is not examined: a failed open leaves the handle absent,
    // and that is what every conversion checks.
    (void)zo_iconv_open_1(codeset, flags, handle);
}

int32_t convert(zo_iconv_t handle, const char *fn, const char *in, size_t *inlen, char **out, size_t *outlen,
                size_t *utf8_length) {
    if (!handle) return acl::set_error(ACL_RC_CODESET, acl::msg::CODESET_INIT);
    // The location names the conversion call itself, so it is taken on its line.
    const source_loc at{ACL_LOC_UTILS}; const int zrc = zo_iconv_str_1(handle, 0, in, inlen, out, outlen);
    switch (zrc) {
    case 0:
        return ACL_RC_OK;
    case ZO_ICONV_RC_BAD_HANDLE:
    case ZO_ICONV_RC_BAD_ARGS:
        return acl::set_error(ACL_RC_INTERNAL, acl::msg::INTERNAL, at.file, at.line, zrc);
    case ZO_ICONV_RC_NO_MEMORY: {
        // For the direction to UTF-8 the converter has put the size it
        // could not allocate into the output length; the caller gets its
        // output length back as it gave it.
        const size_t attempted = utf8_length ? *utf8_length : 0;
        *outlen = 0;
        return acl__no_memory(fn, attempted);
    }
    default:
        return acl::set_error(ACL_RC_CODESET, acl::msg::CODESET_CONVERT);
    }
}

}  // namespace

void acl__init_to_utf8_handle(void) { open_handle(0, &acl__to_utf8_hdl); }
void acl__init_from_utf8_handle(void) { open_handle(ZO_ICONV_FROM_UTF8, &acl__from_utf8_hdl); }

void acl__set_codeset_for_test(bool from_utf8, const char *codeset) {
    g_codeset_override[from_utf8 ? 1 : 0].store(codeset, std::memory_order_release);
}

int32_t acl__convert_to_utf8(const char *local_string, size_t *local_length, char **utf8_string,
                             size_t *utf8_length) {
    pthread_once(&acl__init_to_utf8_once_block, acl__init_to_utf8_handle);
    return convert(acl__to_utf8_hdl, "acl__convert_to_utf8", local_string, local_length, utf8_string,
                   utf8_length, utf8_length);
}

int32_t acl__convert_from_utf8(const char *utf8_string, size_t *utf8_length, char **local_string,
                               size_t *local_length) {
    pthread_once(&acl__init_from_utf8_once_block, acl__init_from_utf8_handle);
    return convert(acl__from_utf8_hdl, "acl__convert_from_utf8", utf8_string, utf8_length, local_string,
                   local_length, utf8_length);
}
