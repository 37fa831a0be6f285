// The bulk check: one ACL file read whole, parsed entry by entry into the
// ACL trees exactly as the library compiles a file, every fault reported,
// and with -s the compiled ACL stored in NAME.cacl.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "aclfck.h"
#include "ryacl.h"
#include "ryacl_acl_dump.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

// The checker's own messages for the file.
acl__textfile_opts checker_opts(uint32_t flags) {
    acl__textfile_opts o{ACL_RC_BAD_FILE_NAME, acl::msg::CHECK_FILE_BAD.num, acl::msg::CHECK_FILE_NOT_OWNED.num,
                         acl::msg::CHECK_FILE_OPEN.num};
    o.keep_going = (flags & ACLFCK_CONTINUE) != 0;
    o.each_entry = (flags & ACLFCK_VERBOSE) != 0;
    o.permset = &acl__default_perm_set;
    o.trees_borrow_text = true;  // aclfck__check frees the trees first
    return o;
}

// ryaclfck prints everything on standard error as it comes.
struct print_sink final : acl__text_sink {
    void fault(int32_t, int32_t) override { acl::report_current_error(stderr, true); }
    void entry(const sec_acle_desc &acle, int32_t) override { sec__dump_acle(&acle, nullptr, ""); }
};

// What a quiet pass meets is not shown; that it met anything is enough.
struct quiet_sink final : acl__text_sink {
    bool met = false;
    void fault(int32_t, int32_t) override { met = true; }
    void entry(const sec_acle_desc &, int32_t) override {}
};

// One check of the file from the start; `defer`: duplicates are left to
// the sort that writes the cache (acl__trees_s::defer_duplicates).
int32_t check_pass(const char *aclfname, const char *username, uint32_t flags, acl__text_sink &sink,
                   acl__parse_result *res, bool defer) {
    const acl__textfile_opts o = checker_opts(flags);
    acl__aclfile_s f;
    char *text = nullptr;
    size_t size = 0;
    int32_t rc = acl__open_aclfile(aclfname, username, o, &f);
    if (rc == 0 && f.fd < 0) rc = acl__open_failed(o, f);
    if (rc == 0) rc = acl__read_aclfile(&f, &text, &size);
    if (rc != 0) {
        sink.fault(rc, 0);
        return rc;
    }
    acl__parse_result local;
    if (!res) res = &local;
    if (size == 0) {
        if (flags & ACLFCK_VERBOSE) sink.fault(acl::set_error(ACL_RC_INFO, acl::msg::FILE_EMPTY, f.name), 0);
        return 0;  // the cache file is not touched
    }

    acl__trees_s trees;
    trees.defer_duplicates = defer;
    const int32_t stopped = acl__parse_acltext(text, size, o, sink, &trees, res);
    int32_t result = stopped;
    if (flags & ACLFCK_CACHE) {
        if (stopped != 0 || !res->clean) {
            sink.fault(acl::set_error(ACL_RC_INFO, acl::msg::CACHE_SKIPPED), 0);
        } else {
            // Streamed: the compiled ACL never needs its whole size in memory.
            rc = acl__cache_acltrees(f.name, &trees, 1);
            // 1 means there was nothing to store and records nothing; a
            // compiled ACL is never empty, so it cannot arise here, and it
            // is no failure.
            if (rc != 0 && rc != ACL_RC_INFO) {
                sink.fault(rc, 0);
                result = rc;
            }
        }
    }
    acl__free_trees(&trees);  // releases the last tree first
    std::free(text);          // the parsed entries pointed into it
    return result;
}

}  // namespace

int32_t aclfck__get_aclfile(const char *aclfname, const char *username, char *name) {
    acl__aclfile_s f;
    const int32_t rc = acl__open_aclfile(aclfname, username, checker_opts(0), &f);
    std::memcpy(name, f.name, sizeof f.name);
    return rc;
}

int32_t aclfck__stream_aclfile(const char *, const char *, uint32_t) { return 0; }

// A check that is to store the cache and shows no entry on the way runs
// quietly first, with duplicates found by the sort that writes the cache
// instead of a lookup per entry (a shuffled file spends a fifth of its
// time on those), and stopping at the first fault.  On a clean file that
// is all the ordinary check would do, with or without -c.  Whatever that
// pass meets (a fault, a duplicate, a cache that cannot be written) sends
// the file through the ordinary check from the start, which reports
// exactly what it reports alone: the faulty file is read twice, and the
// output is never the quiet pass's.  A trace would show both passes, so a
// traced check runs the ordinary one only.
int32_t aclfck__check(const char *aclfname, const char *username, uint32_t flags, acl__text_sink &sink,
                      acl__parse_result *res) {
    if ((flags & ACLFCK_CACHE) && !(flags & ACLFCK_VERBOSE) && !acl::trace::any_on()) {
        quiet_sink quiet;
        acl__parse_result quiet_res;
        if (check_pass(aclfname, username, flags & ~ACLFCK_CONTINUE, quiet, &quiet_res, true) == 0 && !quiet.met) {
            if (res) *res = quiet_res;
            return 0;
        }
    }
    return check_pass(aclfname, username, flags, sink, res, false);
}

int32_t aclfck__bulk_aclfile(const char *aclfname, const char *username, uint32_t flags) {
    print_sink sink;
    return aclfck__check(aclfname, username, flags, sink);
}
