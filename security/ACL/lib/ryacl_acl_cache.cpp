// The compiled ACL cache file NAME.cacl: written beside the ACL file through
// an exclusively created temporary file that gets the ACL file's owner,
// group and mode and is then renamed over the cache name, so a reader sees
// the old or the new cache whole and never one with the wrong identity.
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <cstring>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_file.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace tr = acl::trace;

namespace {

constexpr size_t kMaxPath = ACL_FNAME_AREA - 1;
// Each failed exclusive creation appends four more digits; a handful of
// collisions in a row means someone is planting names, not bad luck.
constexpr int kMaxTmpAttempts = 8;
// Below this a cache is a few pages and one more system call buys nothing.
constexpr size_t kPreallocMin = size_t{1} << 20;
// Written bytes handed to the device in stretches of this size.
constexpr size_t kWriteBehind = size_t{4} << 20;

// 16 bits for a temporary name.  The name need not be secret (exclusive
// creation is what makes it safe), only hard to guess in advance; when the
// kernel's source is unavailable or not yet seeded, a mix of clock, pid and
// a counter still keeps concurrent writers apart.  Never blocks.
uint16_t random16() {
    uint16_t v = 0;
    for (;;) {
        ssize_t n = getrandom(&v, sizeof v, GRND_NONBLOCK);
        if (n == static_cast<ssize_t>(sizeof v)) return v;
        if (n < 0 && errno == EINTR) continue;
        break;
    }
    static std::atomic<uint32_t> counter{0};
    struct timespec ts {};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    uint64_t x = static_cast<uint64_t>(ts.tv_nsec) ^ (static_cast<uint64_t>(ts.tv_sec) << 20) ^
                 (static_cast<uint64_t>(getpid()) << 32) ^ counter.fetch_add(0x9e37u, std::memory_order_relaxed);
    x ^= x >> 33;
    x *= 0xff51afd7ed558ccdULL;
    x ^= x >> 33;
    return static_cast<uint16_t>(x);
}

// The bytes of a cache file: `length` of them, handed to a sink in order.
struct cache_source {
    size_t length;
    int32_t (*produce)(const void *ctx, const acl__byte_sink *sink);
    const void *ctx;
};

struct cache_writer {
    const char *aclfname;
    cache_source src;
    char caclfname[ACL_FNAME_AREA];
    char tmpname[ACL_FNAME_AREA];
    struct stat acl_st {};
    // The ACL file's directory, and where the base name starts in each of
    // the three names: every file operation is relative to this descriptor.
    int dirfd = -1;
    size_t base = 0;
    int cachefd = -1;  // existing cache, opened for writing, never written
    int tmpfd = -1;
    bool tmp_created = false;

    int32_t check_existing(sec_boolean_t force);
    int32_t create_tmp();
    int32_t fill_tmp();
    void cleanup(int32_t rc);

    size_t done = 0;  // bytes written to the temporary file
    size_t sent = 0;  // of them, handed to the device ahead of the fsync
    static int32_t put(void *ctx, const unsigned char *p, size_t n);
};

// Before anything is written: look at an existing cache without following a
// link, compare its identity, decide whether it is current.
//
// No placeholder is ever created at the cache name: a writer killed between
// creating one and the rename would leave an empty mode-0 file that fails
// every later owner/mode comparison.  The cache name comes into being only
// through the final rename, so after a failure a cache that did not exist
// still does not, with nothing to remove.  An existing cache is opened for
// writing (no create, no truncate, never written) so that one the process
// may not write is still refused with message 138 before anything is made;
// the lock step is called on that descriptor, or on -1 when there is none.
int32_t cache_writer::check_existing(sec_boolean_t force) {
    struct stat cst {};
    bool exists = false;

    // O_PATH needs no permission on the file and has no side effect even on
    // a device or FIFO; with O_NOFOLLOW a link gives a descriptor of the
    // link itself.
    acl__file_step("cache:open", caclfname);
    int pfd = openat(dirfd, caclfname + base, O_PATH | O_NOFOLLOW | O_CLOEXEC);
    if (pfd < 0) {
        int err = errno;
        if (err != ENOENT) {
            tr::point(tr::ERRORS, 109, {tr::str(caclfname), tr::str("stat()"), tr::val(err)});
            return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::BAD_FILE, aclfname, err);
        }
        tr::point(tr::INFO, 110, {tr::str(caclfname)});
    } else {
        int frc = fstat(pfd, &cst);
        int err = errno;
        close(pfd);
        if (frc != 0) {
            tr::point(tr::ERRORS, 109, {tr::str(caclfname), tr::str("stat()"), tr::val(err)});
            return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::BAD_FILE, aclfname, err);
        }
        // A link at the cache name is left alone: rename would replace it,
        // but whoever planted it is up to something.
        if (S_ISLNK(cst.st_mode)) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_OPEN, caclfname);
        exists = true;
    }

    if (exists) {
        if (cst.st_uid != acl_st.st_uid || cst.st_gid != acl_st.st_gid) {
            uint32_t cu = cst.st_uid, cg = cst.st_gid, au = acl_st.st_uid, ag = acl_st.st_gid;
            tr::point(tr::ERRORS, 111, {tr::str(caclfname), tr::val(cu), tr::val(cg), tr::val(au), tr::val(ag)});
            return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_OWNER, aclfname);
        }
        if (cst.st_mode != acl_st.st_mode) {
            uint32_t cm = cst.st_mode & 0xfffu, am = acl_st.st_mode & 0xfffu;
            tr::point(tr::ERRORS, 111, {tr::str(caclfname), tr::val(cm), tr::val(am)});
            return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_MODE, aclfname);
        }
        if (!force && acl_st.st_mtim.tv_sec < cst.st_mtim.tv_sec) return ACL_RC_INFO;

        acl__file_step("cache:open-write", caclfname);
        cachefd = openat(dirfd, caclfname + base, O_WRONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC);
        struct stat wst {};
        if (cachefd < 0 || fstat(cachefd, &wst) != 0 || wst.st_dev != cst.st_dev || wst.st_ino != cst.st_ino)
            return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_OPEN, caclfname);
    }
    return acl__lock_acl_file(caclfname, cachefd, 2);
}

// Exclusive creation without following links: a name planted in the
// directory (file or link) is never opened, only skipped.
int32_t cache_writer::create_tmp() {
    size_t pos = std::strlen(aclfname);
    std::memcpy(tmpname, aclfname, pos);
    tmpname[pos++] = '.';
    tmpname[pos] = '\0';
    for (int attempt = 0; attempt < kMaxTmpAttempts && pos + 4 <= kMaxPath; ++attempt) {
        std::snprintf(tmpname + pos, 5, "%04x", static_cast<unsigned>(random16()));
        pos += 4;
        acl__file_step("cache:open-tmp", tmpname);
        tmpfd = openat(dirfd, tmpname + base, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0);
        if (tmpfd >= 0) {
            tmp_created = true;
            return 0;
        }
        // Only a taken name is worth another try; anything else (no space,
        // no permission, name too long) a longer name will not cure.
        if (errno != EEXIST && errno != EINTR) break;
    }
    // The report names the temporary file, as the message's text says; its
    // name is the cache file's plus a dot and hex digits, so it still points
    // the reader at the directory and the file in question.
    return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_OPEN, tmpname);
}

// Write, then give the file its identity, then make it durable, all on the
// descriptor: the file never appears under its final name with the wrong
// owner or mode, and a crash after the rename finds it whole.
int32_t cache_writer::put(void *ctx, const unsigned char *data, size_t len) {
    auto *w = static_cast<cache_writer *>(ctx);
    size_t at = 0;
    while (at < len) {
        acl__file_step("cache:write", w->tmpname);
        ssize_t n = write(w->tmpfd, data + at, len - at);
        if (n < 0 && errno == EINTR) continue;
        // n == 0: no progress and no errno; give up rather than spin.
        if (n <= 0) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_WRITE, w->done, w->src.length, n < 0 ? errno : 0);
        at += static_cast<size_t>(n);
        w->done += static_cast<size_t>(n);
    }
    // Start writing what is here to the device while the rest is produced,
    // so that the fsync at the end waits for a stretch, not the whole file.
    // Only a hint: the fsync still reports any failure.
    if (w->done - w->sent >= kWriteBehind) {
        (void)sync_file_range(w->tmpfd, static_cast<off_t>(w->sent), static_cast<off_t>(w->done - w->sent),
                              SYNC_FILE_RANGE_WRITE);
        w->sent = w->done;
    }
    return 0;
}

int32_t cache_writer::fill_tmp() {
    const size_t len = src.length;
    // Reserving the blocks in one extent spares the filesystem a block
    // reservation per page as the writes arrive (about a third of the
    // kernel's cost of a large cache).  Only a hint: where it fails (no
    // support, no space) the writes themselves decide and report.
    if (len > kPreallocMin && len <= static_cast<size_t>(INT64_MAX))
        (void)fallocate(tmpfd, 0, 0, static_cast<off_t>(len));
    const acl__byte_sink sink{put, this};
    if (int32_t rc = src.produce(src.ctx, &sink)) return rc;
    if (done != len) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_WRITE, done, len, 0);

    acl__file_step("cache:fchown", tmpname);
    if (fchown(tmpfd, acl_st.st_uid, acl_st.st_gid) != 0) {
        char uidtext[24];
        std::snprintf(uidtext, sizeof uidtext, "%ju", static_cast<uintmax_t>(acl_st.st_uid));
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_CHOWN, caclfname, uidtext, acl_st.st_gid);
    }
    // After fchown, which may clear set-id bits.
    acl__file_step("cache:fchmod", tmpname);
    if (fchmod(tmpfd, acl_st.st_mode & 0xfffu) != 0)
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_CHMOD, caclfname, acl_st.st_mode & 0xfffu);

    // A failed fsync or close can mean the bytes never reached the disk:
    // reported as a failed write with everything handed over.
    acl__file_step("cache:fsync", tmpname);
    if (fsync(tmpfd) != 0) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_WRITE, done, len, errno);
    acl__file_step("cache:close", tmpname);
    int crc = close(tmpfd);
    tmpfd = -1;
    if (crc != 0) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_WRITE, done, len, errno);

    acl__file_step("cache:rename", tmpname);
    if (renameat(dirfd, tmpname + base, dirfd, caclfname + base) != 0)
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CACHE_RENAME, tmpname, caclfname);
    tmp_created = false;
    return 0;
}

// The first error stays the one reported: nothing here records another.
void cache_writer::cleanup(int32_t rc) {
    if (tmpfd >= 0) close(tmpfd);
    if (rc != 0 && tmp_created) {
        acl__file_step("cache:unlink", tmpname);
        unlinkat(dirfd, tmpname + base, 0);
    }
    if (cachefd >= 0) close(cachefd);
    if (dirfd >= 0) close(dirfd);
}

// Everything after the caller's own checks: name, directory, identity of
// the ACL file, the existing cache, the temporary file, its bytes, the rename.
int32_t store(const char *aclfname, const cache_source &src, sec_boolean_t force) {
    size_t nlen = std::strlen(aclfname);
    if (nlen > ACL_CACHE_MAX_ACLFNAME) {
        uint32_t len32 = static_cast<uint32_t>(nlen);
        tr::point(tr::ERRORS, 108, {tr::str(aclfname), tr::val(len32)});
        return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::FILE_NAME_TOO_LONG, aclfname);
    }

    cache_writer w{};
    w.aclfname = aclfname;
    w.src = src;
    std::memcpy(w.caclfname, aclfname, nlen);
    std::memcpy(w.caclfname + nlen, ACL_CACHE_SUFFIX, sizeof ACL_CACHE_SUFFIX);

    // The directory is opened once and every name taken relative to it: a
    // directory moved or replaced while the cache is written then cannot
    // split the work between two directories, leaving the temporary file
    // where the rename and its removal no longer look.  The ACL file is
    // still looked up through links, as by name.
    const char *slash = std::strrchr(aclfname, '/');
    w.base = slash ? static_cast<size_t>(slash - aclfname) + 1 : 0;
    char dirname[ACL_FNAME_AREA] = ".";
    if (w.base) {
        std::memcpy(dirname, aclfname, w.base);
        dirname[w.base] = '\0';
    }
    int32_t rc = 0;
    w.dirfd = open(dirname, O_PATH | O_DIRECTORY | O_CLOEXEC);
    int err = errno;
    if (w.dirfd >= 0) {
        acl__file_step("cache:stat-acl", aclfname);
        err = fstatat(w.dirfd, aclfname + w.base, &w.acl_st, 0) != 0 ? errno : 0;
    }
    if (w.dirfd < 0 || err) {
        tr::point(tr::ERRORS, 109, {tr::str(aclfname), tr::str("stat()"), tr::val(err)});
        rc = acl::set_error(ACL_RC_FILE_ERROR, acl::msg::BAD_FILE, aclfname, err);
    }

    if (rc == 0) rc = w.check_existing(force);
    if (rc == 0) rc = w.create_tmp();
    if (rc == 0) rc = w.fill_tmp();
    w.cleanup(rc);
    return rc;
}

int32_t put_buffer(const void *ctx, const acl__byte_sink *sink) {
    const auto *acl = static_cast<const sec_acl_buffer_desc *>(ctx);
    return sink->put(sink->ctx, static_cast<const unsigned char *>(acl->value), static_cast<size_t>(acl->length));
}

struct planned_trees {
    const acl__trees_s *trees;
    acl__acl_plan plan;
};

int32_t put_trees(const void *ctx, const acl__byte_sink *sink) {
    const auto *p = static_cast<const planned_trees *>(ctx);
    return acl__acltrees_emit(p->trees, p->plan, sink);
}

}  // namespace

int32_t sec__cache_aclbuffer(const char *aclfname, const sec_acl_buffer_desc *acl, sec_boolean_t force) {
    if (!aclfname) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__cache_aclbuffer", 1, 0);
    // An absent descriptor holds no ACL, like an empty one.
    if (!acl || acl->length == 0) {
        if (tr::level(tr::INFO) == 1) tr::record_data(107, {tr::str(aclfname)});
        return ACL_RC_INFO;
    }
    if (acl->length < 0 || !acl->value)
        return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__cache_aclbuffer", 2, acl);
    return store(aclfname, {static_cast<size_t>(acl->length), put_buffer, acl}, force);
}

int32_t acl__cache_acltrees(const char *aclfname, const acl__trees_s *trees, sec_boolean_t force) {
    if (!aclfname) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "acl__cache_acltrees", 1, 0);
    // Refusals of the trees come before any file is looked at, as when the
    // compiled ACL is built first.
    planned_trees p{trees, {}};
    if (int32_t rc = acl__acltrees_size(trees, &p.plan)) return rc;
    return store(aclfname, {p.plan.total, put_trees, &p}, force);
}
