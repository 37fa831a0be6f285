// Reading an ACL file into a compiled ACL: from its cache file when that is
// current and carries the text file's owner, group and mode, else by
// parsing the text (and then, when asked, storing the cache).
//
// The cache file is only ever a shortcut.  Whatever goes wrong with it is
// passed over in silence and the text is compiled instead.  Between the
// look at the cache name and the open, the name may come to denote another
// file; the open never follows a link and never blocks, and the descriptor
// must still be the regular file whose owner, group, mode and time were
// checked, or the cache is passed over too.  The text file itself is
// opened first and vetted through its descriptor (ryacl_acl_textfile.cpp),
// so a text replaced meanwhile is simply read in its new version.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "ryacl_acl_buffer.h"
#include "ryacl_acl_check.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

namespace tr = acl::trace;

bool same_file(const struct stat &a, const struct stat &b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

// The checks of a cache file against its ACL file that decide whether it
// may be used; 0 when it may, else a reason for the trace.
int cache_unusable(const struct stat &acl_st, const struct stat &c) {
    if (!S_ISREG(c.st_mode)) return 1;
    // Equal seconds are stale: a change within the second of the cache
    // write would go unseen.
    if (c.st_size == 0 || c.st_mtime <= acl_st.st_mtime) return 2;
    if (c.st_uid != acl_st.st_uid || c.st_gid != acl_st.st_gid ||
        (c.st_mode & 07777) != (acl_st.st_mode & 07777))
        return 3;
    return 0;
}

// Each parsed entry, for the trace at "Info" levels above 7; faults stop
// the parse and stay the current error.
struct trace_sink final : acl__text_sink {
    void fault(int32_t, int32_t) override {}
    void entry(const sec_acle_desc &e, int32_t line) override {
        tr::record_data(114, {tr::val(line + 1), tr::val(e.type), tr::val(e.perm),
                              tr::strn(e.mech, sizeof e.mech), tr::str(e.id)});
    }
};

struct reader {
    const char *filename;
    const char *username;
    const sec_perm_set_desc *permtmpl;
    sec_buffer_t acl;
    uint32_t flags;  // the working copy
    int32_t lineno = 0;
    acl__aclfile_s text;  // the text file, opened and vetted
    const char *aclfname = text.name;
    char caclfname[ACL_FNAME_AREA] = {};
    struct stat cache_st {};
    char *aclfbuf = nullptr;
    size_t aclfsize = 0;
    acl__textfile_opts opts{ACL_RC_FILE_ERROR, acl::msg::BAD_FILE.num, acl::msg::FILE_NOT_OWNED.num, acl::msg::FILE_OPEN.num, true, false,
                            tr::level(tr::INFO) > 7, permtmpl, true};  // parse() frees the trees first

    reader(const char *fn, const char *un, const sec_perm_set_desc *pt, sec_buffer_t a, uint32_t f)
        : filename(fn), username(un), permtmpl(pt), acl(a), flags(f) {}
    int32_t run();
    bool choose_cache();
    bool take_cache();
    int32_t parse();

    void fall_back(int why) {
        tr::point(tr::INFO, 120, {tr::str(caclfname), tr::val(why)});
        acl::clear_error();
        std::free(aclfbuf);
        aclfbuf = nullptr;
        aclfsize = 0;
        flags |= SEC_ACLF_FROM_TEXT;
    }
};

// Whether the cache file is to be tried.
bool reader::choose_cache() {
    if (flags & SEC_ACLF_FROM_TEXT) {
        tr::point(tr::INFO, 116, {tr::str(aclfname)});
        return false;
    }
    const size_t n = std::strlen(aclfname);
    if (n > ACL_CACHE_MAX_ACLFNAME) {
        // No room for the suffix: the cache is taken as absent.
        tr::point(tr::INFO, 122, {tr::str(aclfname)});
        flags |= SEC_ACLF_FROM_TEXT;
        return false;
    }
    std::memcpy(caclfname, aclfname, n);
    std::memcpy(caclfname + n, ACL_CACHE_SUFFIX, sizeof ACL_CACHE_SUFFIX);
    int why = 0;
    if (stat(caclfname, &cache_st) != 0) why = -errno;
    else why = cache_unusable(text.st, cache_st);
    tr::point(tr::INFO, 117, {tr::str(caclfname), tr::val(why)});
    if (why) {
        flags |= SEC_ACLF_FROM_TEXT;
        return false;
    }
    return true;
}

// Take the compiled ACL from the cache file: true when it was handed over.
bool reader::take_cache() {
    acl__file_step("read:open", caclfname);
    int fd = open(caclfname, O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK);
    if (fd < 0) {
        fall_back(-errno);
        return false;
    }
    tr::point(tr::INFO, 119, {tr::str(caclfname)});
    struct stat fst;
    if (fstat(fd, &fst) != 0 || !same_file(fst, cache_st) || cache_unusable(text.st, fst) ||
        fst.st_mtime != cache_st.st_mtime) {
        close(fd);
        fall_back(4);
        return false;
    }
    tr::perf_timer step(2);
    int32_t rc = acl__lock_acl_file(caclfname, fd, 1);
    if (!rc) rc = acl__read_acl_file(caclfname, fd, &aclfbuf, &aclfsize);
    close(fd);
    if (step.armed()) step.record(4, {tr::str(caclfname)});
    if (rc || !aclfbuf || aclfsize == 0 || aclfsize > INT32_MAX) {
        fall_back(rc ? rc : 5);
        return false;
    }
    sec_buffer_desc desc{static_cast<int32_t>(aclfsize), aclfbuf};
    if (flags & SEC_ACLF_CONVERT_CACHE) {
        // Conversion validates only what is already in host order; what it
        // reversed is validated after it.
        const bool foreign = aclfsize > 2 && static_cast<unsigned char>(aclfbuf[2]) != 2;
        rc = sec_convert_acl_to_host(1, &desc);
        if (!rc && foreign) rc = sec__check_acl_buffer(&desc);
        if (rc) {
            fall_back(rc);
            return false;
        }
    }
    // The read buffer itself becomes the compiled ACL.
    *acl = desc;
    aclfbuf = nullptr;
    flags &= ~static_cast<uint32_t>(SEC_ACLF_WRITE_CACHE);
    return true;
}

// The text: read, parsed into trees, compiled and, when asked, cached.
int32_t reader::parse() {
    flags &= ~static_cast<uint32_t>(SEC_ACLF_CONVERT_CACHE);
    tr::perf_timer timer(1);
    acl__trees_s trees;
    acl__parse_result res;
    trace_sink sink;
    int32_t rc = acl__parse_acltext(aclfbuf, aclfsize, opts, sink, &trees, &res);
    lineno = res.lineno;
    if (!rc && trees.nooftrees > 0) rc = sec__acltrees_to_acl(&trees, acl);
    acl__free_trees(&trees);
    if (timer.armed()) timer.record(3, {tr::str(aclfname), tr::val(lineno)});
    if (rc) {
        std::free(acl->value);
        acl->value = nullptr;
        acl->length = 0;
        return rc;
    }
    if (flags & SEC_ACLF_WRITE_CACHE) {
        int32_t c = sec__cache_aclbuffer(aclfname, acl, 0);
        tr::point(tr::INFO, 121, {tr::str(aclfname), tr::val(c)});
        if (c != 0) {
            // A cache that cannot be written never fails the read.
            acl::clear_error();
            flags &= ~static_cast<uint32_t>(SEC_ACLF_WRITE_CACHE);
        }
    }
    return 0;
}

int32_t reader::run() {
    int32_t rc = acl__open_aclfile(filename, username, opts, &text);
    if (rc) return rc;
    if (text.st.st_size == 0) return 0;

    tr::perf_timer choice(1);
    bool cache = choose_cache();
    if (choice.armed()) choice.record(1, {tr::str(cache ? caclfname : aclfname)});
    tr::perf_timer reading(1);
    if (cache && take_cache()) {
        if (reading.armed()) reading.record(2, {tr::str(caclfname)});
        return 0;
    }
    // The text was found but could not be opened; with a usable cache that
    // did not matter.
    if (text.fd < 0) return acl__open_failed(opts, text);
    tr::point(tr::INFO, 119, {tr::str(aclfname)});
    tr::perf_timer step(2);
    rc = acl__read_aclfile(&text, &aclfbuf, &aclfsize);
    if (step.armed()) step.record(4, {tr::str(aclfname)});
    if (reading.armed()) reading.record(2, {tr::str(aclfname)});
    if (rc) return rc;
    return parse();
}

}  // namespace

int32_t sec_read_acl_file(const char *filename, const char *username, sec_perm_set_t permtmpl,
                          uint32_t flags, sec_buffer_t acl, uint32_t *rflags) {
    tr::api_entry(9, 11,
                  {tr::str(filename), tr::str(username), tr::val(permtmpl), tr::val(flags),
                   tr::val(acl)});
    acl::clear_error();
    int32_t rc = 0;
    int32_t lineno = 0;
    uint32_t wflags = flags;
    if (!filename) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_read_acl_file", 1, 0);
    } else if (!acl) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec_read_acl_file", 5, 0);
    } else if (username && !*username) {
        rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_USER_NAME);
    } else {
        acl->length = 0;
        acl->value = nullptr;
        if (rflags) *rflags = 0;
        reader r{filename, username, permtmpl, acl, flags};
        rc = r.run();
        std::free(r.aclfbuf);
        wflags = r.flags;
        lineno = r.lineno;
    }
    if (rflags) *rflags = wflags;
    tr::api_exit(12, 13, 14, rc, {tr::val(lineno)});
    return rc;
}
