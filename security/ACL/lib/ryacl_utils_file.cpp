// Reading an ACL file (text or cached compiled form) whole, and the lock
// step every reader and the cache writer pass through.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "ryacl_acl_file.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

std::atomic<acl__file_step_hook_t> acl__file_step_hook{nullptr};

void acl__set_file_step_hook(acl__file_step_hook_t hook) {
    acl__file_step_hook.store(hook, std::memory_order_relaxed);
}

namespace tr = acl::trace;

namespace {

int32_t read_whole(const char *aclfname, int aclfdes, char **aclfbuf, size_t *aclfsize) {
    const char *name = aclfname ? aclfname : "";

    // The size comes from the descriptor: a name can be swapped between a
    // lookup and the read, the open file cannot.
    struct stat st;
    acl__file_step("read:fstat", name);
    if (fstat(aclfdes, &st) != 0) {
        int err = errno;
        tr::point(tr::INFO, 123, {tr::str(name), tr::val(err)});
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::BAD_FILE, name, err);
    }
    // A FIFO or device has no size to read up to, and a directory no
    // contents; the lookup itself succeeded, so there is no errno to give.
    if (!S_ISREG(st.st_mode)) {
        int err = 0;
        tr::point(tr::INFO, 123, {tr::str(name), tr::val(err)});
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::BAD_FILE, name, err);
    }
    if (st.st_size == 0) return 0;

    uint64_t size = static_cast<uint64_t>(st.st_size);
    if (size >= SIZE_MAX) {
        tr::point(tr::INFO, 125, {tr::str(name), tr::val(size)});
        return acl__no_memory("sec_read_acl_file", size);
    }
    size_t want = static_cast<size_t>(size);
    char *buf = static_cast<char *>(acl__malloc(want + 1));
    if (!buf) {
        tr::point(tr::INFO, 125, {tr::str(name), tr::val(size)});
        return acl__no_memory("sec_read_acl_file", want + 1);
    }
    // A large file fills thousands of fresh pages; huge ones fault far less.
    acl__advise_large(buf, want + 1);

    // read() may return less than asked on any file system; go on until the
    // size is reached or the file ends.  A file that grew is read only up
    // to the size taken above.
    size_t got = 0;
    int err = 0;
    while (got < want) {
        acl__file_step("read:read", name);
        ssize_t n = read(aclfdes, buf + got, want - got);
        if (n < 0) {
            if (errno == EINTR) continue;
            err = errno;
            break;
        }
        if (n == 0) break;
        got += static_cast<size_t>(n);
    }
    if (got != want) {
        uint64_t count = got;
        tr::point(tr::INFO, 127, {tr::str(name), tr::val(size), tr::val(count)});
        std::free(buf);
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::FILE_READ, got, want, err);
    }
    buf[want] = '\0';
    *aclfbuf = buf;
    *aclfsize = want;
    return 0;
}

}  // namespace

int32_t acl__read_acl_file(const char *aclfname, int aclfdes, char **aclfbuf, size_t *aclfsize) {
    if (!aclfbuf) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__read_acl_file", 3, 0);
    if (!aclfsize) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__read_acl_file", 4, 0);
    tr::perf_timer timer(2);
    *aclfbuf = nullptr;
    *aclfsize = 0;
    int32_t rc = read_whole(aclfname, aclfdes, aclfbuf, aclfsize);
    if (timer.armed()) timer.record(6, {});
    return rc;
}

int32_t acl__lock_acl_file(const char *aclfname, int aclfdes, uint32_t flags) {
    // Nothing is locked: readers rely on the cache being replaced by rename.
    (void)aclfname;
    (void)aclfdes;
    (void)flags;
    return 0;
}
