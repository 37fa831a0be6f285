// The bulk check: one ACL file read whole, parsed entry by entry into the
// ACL trees exactly as the library compiles a file, every fault printed,
// and with -s the compiled ACL stored in NAME.cacl.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>

#include "aclfck.h"
#include "ryacl.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_dump.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"

namespace {

void print_error() { acl::report_current_error(stderr, true); }

// Open the vetted file and make sure the descriptor still refers to it.
// O_NONBLOCK keeps a FIFO swapped in after the vetting from hanging the
// open; O_NOCTTY keeps a terminal from becoming ours.
int32_t open_vetted(const char *name, const struct stat &vetted, int *fd) {
    *fd = open(name, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (*fd < 0) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::CHECK_FILE_OPEN, name, errno);
    struct stat st;
    int err = 0;
    if (fstat(*fd, &st) != 0) {
        err = errno;
    } else if (S_ISREG(st.st_mode) && st.st_dev == vetted.st_dev && st.st_ino == vetted.st_ino) {
        // Back to blocking reads, the mode the reader expects; regular files
        // never block, so a failure here changes nothing.
        int fl = fcntl(*fd, F_GETFL);
        if (fl != -1) (void)fcntl(*fd, F_SETFL, fl & ~O_NONBLOCK);
        return 0;
    }
    // fstat failed (its errno is reported), or the name was replaced
    // between the lookup and the open, which no errno describes: 0.
    close(*fd);
    *fd = -1;
    return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::CHECK_FILE_BAD, name, err);
}

}  // namespace

int32_t aclfck__get_aclfile(const char *aclfname, const char *username, char *name,
                            struct stat *vetted) {
    uid_t uid = 0;
    int32_t rc = sec__get_aclfname(aclfname, username, name, &uid);
    if (rc != 0) return rc;

    struct stat st;
    if (stat(name, &st) != 0) return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::CHECK_FILE_BAD, name, errno);
    // errno means nothing after a successful lookup: report 0 rather than
    // whatever an earlier call left behind.
    if (!S_ISREG(st.st_mode)) return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::CHECK_FILE_BAD, name, 0);
    if (vetted) *vetted = st;
    if (!username) return 0;
    if (st.st_uid != uid || (st.st_mode & (S_IWGRP | S_IWOTH)) != 0)
        return acl::set_error(ACL_RC_PERMISSION, acl::msg::CHECK_FILE_NOT_OWNED, name, username);
    return 0;
}

int32_t aclfck__stream_aclfile(const char *, const char *, uint32_t) { return 0; }

int32_t aclfck__bulk_aclfile(const char *aclfname, const char *username, uint32_t flags) {
    char name[ACL_FNAME_AREA];
    struct stat vetted;
    int32_t rc = aclfck__get_aclfile(aclfname, username, name, &vetted);
    if (rc != 0) {
        print_error();
        return rc;
    }

    int fd;
    if ((rc = open_vetted(name, vetted, &fd)) != 0) {
        print_error();
        return rc;
    }
    if ((rc = acl__lock_acl_file(name, fd, 1)) != 0) {
        close(fd);
        print_error();
        return rc;
    }
    char *text = nullptr;
    size_t size = 0;
    rc = acl__read_acl_file(name, fd, &text, &size);
    close(fd);
    if (rc != 0) {
        print_error();
        return rc;
    }
    if (size == 0) {
        if (flags & ACLFCK_VERBOSE) {
            acl::set_error(ACL_RC_INFO, acl::msg::FILE_EMPTY, name);
            print_error();
        }
        std::free(text);
        return 0;
    }

    char *cursor = text;
    size_t left = size + 1;  // the terminating NUL counts
    int32_t lineno = 1;
    bool clean = true;
    acl__trees_s trees;
    int32_t result = 0;
    bool stopped = false;

    for (;;) {
        sec_acle_desc acle{};
        rc = sec__read_acle_from_text(&acl__default_perm_set, &cursor, &left, &lineno, &acle);
        if (rc == 0) break;
        if (rc != 1) {
            print_error();
            // A memory failure is never a fault of the file: it ends the
            // check even under -c.
            if ((flags & ACLFCK_CONTINUE) && rc != ACL_RC_NO_MEMORY) {
                clean = false;
                continue;
            }
            stopped = true;
            result = rc;
            break;
        }
        if (acle.type == 0) continue;  // blank or comment line
        if (flags & ACLFCK_VERBOSE) sec__dump_acle(&acle, nullptr, "");
        rc = sec__add_acle_to_trees(&acle, &trees);
        if (rc == 0) continue;
        print_error();
        if (rc == ACL_RC_BAD_ACLE && (flags & ACLFCK_CONTINUE)) {
            clean = false;
            continue;
        }
        stopped = true;
        result = rc;
        break;
    }

    if (stopped) {
        if (flags & ACLFCK_CACHE) {
            acl::set_error(ACL_RC_INFO, acl::msg::CACHE_SKIPPED);
            print_error();
        }
    } else if ((flags & ACLFCK_CACHE) && !clean) {
        acl::set_error(ACL_RC_INFO, acl::msg::CACHE_SKIPPED);
        print_error();
    } else if (flags & ACLFCK_CACHE) {
        // Streamed: the compiled ACL never needs its whole size in memory.
        rc = acl__cache_acltrees(name, &trees, 1);
        // 1 means there was nothing to store and records nothing; a compiled
        // ACL is never empty, so it cannot arise here, and it is no failure.
        if (rc != 0 && rc != ACL_RC_INFO) {
            print_error();
            result = rc;
        }
    }

    acl__free_trees(&trees);  // releases the last tree first
    std::free(text);          // the parsed entries pointed into it
    return result;
}
