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
#include <utility>

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

namespace {

// A batch of parsed lines: its entries, their lines and parts, and how the
// batch ended (1: full, 0: end of text, else a faulty line's code, its
// report kept in `fault`).
struct line_batch {
    static constexpr size_t kSize = 32;
    sec_acle_desc acles[kSize];
    acl__entry_parts parts[kSize];
    int32_t lines[kSize];
    size_t n = 0;
    int32_t end = 1;
    int32_t next_line = 1;  // the line after the batch
    acl__line_fault fault;

    // `last`: the entry added just before this batch's first, if known.
    void fill(const acl__textfile_opts &o, const unsigned char *classes, const char *borrow,
              const sec_acle_desc *last, char **cursor, size_t *left, int32_t *lineno) {
        n = 0;
        end = 1;
        acl__line_ctx ctx;
        ctx.classes = classes;
        while (n < kSize) {
            end = acl__read_acle_deferred(o.permset, cursor, left, lineno, &acles[n], &fault, &ctx);
            if (end != 1) break;
            if (acles[n].type == 0) continue;  // blank or comment line
            acl__entry_parts_known(acles[n], ctx.mechlen, ctx.idlen, &parts[n]);
            // Records the parser made: their whole mechanism fields compare.
            const sec_acle_desc *prev = n > 0 ? &acles[n - 1] : last;
            parts[n].same_key_as_previous = prev && prev->type == acles[n].type &&
                                            std::memcmp(prev->mech, acles[n].mech, sizeof prev->mech) == 0;
            if (acl__type_has_id(acles[n].type)) parts[n].text = borrow;
            lines[n++] = *lineno - 1;          // the parser has counted the line it consumed
        }
        next_line = *lineno;
    }
};

}  // namespace

// Lines are parsed a batch ahead of their entries' insertion, and the trees
// fetch what a batch's insertions will touch while the batch before it is
// inserted: on a shuffled file each insertion is otherwise a wait for
// memory.  Everything a caller sees keeps the order of the lines: an entry
// is handed to the sink and added in its turn, and a faulty line that ended
// a batch is recorded only when its turn comes (its report was kept),
// after every entry before it.  Nothing is parsed past a faulty line
// before that line's turn.
int32_t acl__parse_acltext(char *text, size_t size, const acl__textfile_opts &o, acl__text_sink &sink,
                           acl__trees_s *trees, acl__parse_result *res) {
    char *cursor = text;
    size_t left = size + 1;  // the terminating NUL counts
    res->lineno = 1;
    if (!text) return 0;
    int32_t lineno = 1;
    // The sink may print, but never changes this thread's locale.
    const unsigned char *const classes = acl__line_classes();
    // Identifiers stay in the text where the caller keeps it and the trees
    // borrow from no other (offsets into it are 32 bits).
    const char *borrow = nullptr;
    if (o.trees_borrow_text && trees && size < UINT32_MAX &&
        (trees->text ? trees->text == text : trees->nooftrees == 0))
        borrow = trees->text = text;
    line_batch b[2];
    line_batch *cur = &b[0], *ahead = &b[1];
    cur->fill(o, classes, borrow, nullptr, &cursor, &left, &lineno);
    acl__trees_prefetch(trees, cur->parts, cur->n);
    for (;;) {
        ahead->n = 0;
        if (cur->end == 1) {
            ahead->fill(o, classes, borrow, &cur->acles[cur->n - 1], &cursor, &left, &lineno);  // cur is full
            acl__trees_prefetch(trees, ahead->parts, ahead->n);
        }
        for (size_t k = 0; k < cur->n; ++k) {
            const sec_acle_desc &acle = cur->acles[k];
            res->lineno = cur->lines[k] + 1;
            if (o.each_entry) sink.entry(acle, cur->lines[k]);
            const int32_t add = acl__add_parts_to_trees(cur->parts[k], trees);
            if (add == 0) {
                ++res->entries;
                continue;
            }
            sink.fault(add, cur->lines[k]);
            if (add == ACL_RC_BAD_ACLE && o.keep_going) {
                res->clean = false;
                continue;
            }
            return add;
        }
        res->lineno = cur->next_line;
        const int32_t rc = cur->end;
        if (rc == 0) return 0;
        if (rc != 1) {
            acl__record_line_fault(cur->fault);
            sink.fault(rc, cur->fault.line);
            // The parser allocates nothing today; should it ever fail for
            // memory, that is no fault of the file and ends the parse anyway.
            if (!o.keep_going || rc == ACL_RC_NO_MEMORY) return rc;
            res->clean = false;
            sec_acle_desc last{};
            if (cur->n > 0) last = cur->acles[cur->n - 1];
            cur->fill(o, classes, borrow, cur->n > 0 ? &last : nullptr, &cursor, &left, &lineno);
            acl__trees_prefetch(trees, cur->parts, cur->n);
            continue;
        }
        std::swap(cur, ahead);
    }
}
