// One ACL text file from its name to ACL trees: the road the checker,
// `ryacl check` and sec_read_acl_file share.  They differ only in their
// messages, in whether they go past faults, and in what they do with each
// fault and entry (acl__textfile_opts, acl__text_sink).
//
// The file is vetted through the descriptor that is read, never through an
// earlier lookup of its name: configuration tools replace ACL files by
// renaming a new version over them, and a reader must get the old file or
// the new one, whole, not an error.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"

acl__aclfile_s::~acl__aclfile_s() {
    if (fd >= 0) close(fd);
}

int32_t acl__open_aclfile(const char *filename, const char *username, const acl__textfile_opts &o,
                          acl__aclfile_s *f) {
    uid_t uid = 0;
    int32_t rc = sec__get_aclfname(filename, username, f->name, &uid);
    if (rc != 0) return rc;

    // O_NONBLOCK: a FIFO at the name must not hang the open (it is refused
    // below); O_NOCTTY: a terminal never becomes ours.
    acl__file_step("read:open", f->name);
    f->fd = open(f->name, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (f->fd < 0) {
        // Say what a lookup says: a missing file is not an unreadable one.
        f->open_errno = errno;
        if (stat(f->name, &f->st) != 0) return acl::set_error(o.rc_lookup, o.msg_lookup, f->name, errno);
    } else if (fstat(f->fd, &f->st) != 0) {
        const int err = errno;
        close(f->fd);
        f->fd = -1;
        return acl::set_error(o.rc_lookup, o.msg_lookup, f->name, err);
    }
    int32_t refused = 0;
    // The lookup succeeded: no errno describes a file of the wrong type.
    if (!S_ISREG(f->st.st_mode)) {
        refused = acl::set_error(o.rc_lookup, o.msg_lookup, f->name, 0);
    } else if (username && !(o.empty_skips_owner && f->st.st_size == 0) &&
               (f->st.st_uid != uid || (f->st.st_mode & (S_IWGRP | S_IWOTH)) != 0)) {
        refused = acl::set_error(ACL_RC_PERMISSION, o.msg_owner, f->name, username);
    }
    if (refused != 0) {
        if (f->fd >= 0) close(f->fd);
        f->fd = -1;
        return refused;
    }
    if (f->fd >= 0) {
        // Back to blocking reads; a regular file never blocks, so a failure
        // here changes nothing.
        const int fl = fcntl(f->fd, F_GETFL);
        if (fl != -1) (void)fcntl(f->fd, F_SETFL, fl & ~O_NONBLOCK);
    }
    return 0;
}

int32_t acl__open_failed(const acl__textfile_opts &o, const acl__aclfile_s &f) {
    return acl::set_error(ACL_RC_FILE_ERROR, o.msg_open, f.name, f.open_errno);
}

int32_t acl__read_aclfile(acl__aclfile_s *f, char **text, size_t *size) {
    int32_t rc = acl__lock_acl_file(f->name, f->fd, 1);
    if (rc == 0) rc = acl__read_acl_file(f->name, f->fd, text, size);
    close(f->fd);
    f->fd = -1;
    return rc;
}

int32_t acl__parse_acltext(char *text, size_t size, const acl__textfile_opts &o, acl__text_sink &sink,
                           acl__trees_s *trees, acl__parse_result *res) {
    char *cursor = text;
    size_t left = size + 1;  // the terminating NUL counts
    res->lineno = 1;
    if (!text) return 0;
    sec_acle_desc acle;
    for (;;) {
        std::memset(&acle, 0, sizeof acle);
        int32_t rc = sec__read_acle_from_text(o.permset, &cursor, &left, &res->lineno, &acle);
        if (rc == 0) return 0;
        // The parser has counted the line it consumed.
        const int32_t line = res->lineno - 1;
        if (rc == 1) {
            if (acle.type == 0) continue;  // blank or comment line
            if (o.each_entry) sink.entry(acle, line);
            rc = sec__add_acle_to_trees(&acle, trees);
            if (rc == 0) {
                ++res->entries;
                continue;
            }
            sink.fault(rc, line);
            if (rc == ACL_RC_BAD_ACLE && o.keep_going) {
                res->clean = false;
                continue;
            }
            return rc;
        }
        sink.fault(rc, line);
        // The parser allocates nothing today; should it ever fail for
        // memory, that is no fault of the file and ends the parse anyway.
        if (o.keep_going && rc != ACL_RC_NO_MEMORY) {
            res->clean = false;
            continue;
        }
        return rc;
    }
}
