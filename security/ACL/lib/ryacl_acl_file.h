// ACL files on disk: name resolution, reading whole, the lock step and the
// compiled ACL cache file NAME.cacl.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "ryacl.h"

struct acl__trees_s;

#define ACL_FNAME_AREA 4097  // 4096 characters and the NUL
#define ACL_CACHE_SUFFIX ".cacl"
// Longest ACL file name whose cache name still fits ACL_FNAME_AREA.
#define ACL_CACHE_MAX_ACLFNAME 4089

// Resolve filename (and username's home directory) into aclfname.
int32_t sec__get_aclfname(const char *filename, const char *username, char *aclfname, uid_t *uid);
// Look a user up: user id and home directory (hdir: ACL_FNAME_AREA bytes).
int32_t sec__get_user_info(const char *uname, uid_t *uid, char *hdir);

// Read the whole file open on aclfdes into a NUL-terminated heap buffer.
// An empty file gives no buffer and size 0.  The size comes from fstat of
// the descriptor; a descriptor that is not a regular file is refused (122),
// and a file that ends before that size is a short read (126).
int32_t acl__read_acl_file(const char *aclfname, int aclfdes, char **aclfbuf, size_t *aclfsize);
// The lock step between opening and using a file: locks nothing, returns 0.
int32_t acl__lock_acl_file(const char *aclfname, int aclfdes, uint32_t flags);

// ---- One ACL text file, from its name to trees ----------------------------
//
// The checker, `ryacl check` and sec_read_acl_file take the same road:
// resolve the name, open the file and vet what was opened, read it whole,
// parse it into trees.  What differs between them is passed in.

// Messages and habits of one reader.  The return code of a refused open is
// always 37.
struct acl__textfile_opts {
    int32_t rc_lookup;   // missing or not a regular file: 105 (checker), 37 (library)
    int32_t msg_lookup;  // 154, 122
    int32_t msg_owner;   // with a user, not owned by them or writable by others (36): 155, 128
    int32_t msg_open;    // cannot be opened for reading: 156, 124
    bool empty_skips_owner = false;  // an empty file is taken before the owner is checked
    bool keep_going = false;         // pass over faulty lines and duplicate entries
    bool each_entry = false;         // hand every entry to the sink
    const sec_perm_set_desc *permset = nullptr;
    // The caller frees the trees before the text: their identifiers may
    // stay in the text rather than be copied.
    bool trees_borrow_text = false;
};

// Where a parse sends what it meets.  The current error describes a fault
// when fault() is called; `line` is the line that holds it (for a duplicate,
// the line of the repeated entry).
struct acl__text_sink {
    virtual void fault(int32_t rc, int32_t line) = 0;
    virtual void entry(const sec_acle_desc &acle, int32_t line) {
        (void)acle;
        (void)line;
    }
protected:
    ~acl__text_sink() = default;
};

// An opened ACL file: its resolved name and the status of the descriptor.
// fd is -1 when the name passed the lookup but could not be opened
// (open_errno); st is then the status of the name.
struct acl__aclfile_s {
    char name[ACL_FNAME_AREA] = {};
    struct stat st {};
    int fd = -1;
    int open_errno = 0;
    acl__aclfile_s() = default;
    acl__aclfile_s(const acl__aclfile_s &) = delete;
    acl__aclfile_s &operator=(const acl__aclfile_s &) = delete;
    ~acl__aclfile_s();  // closes fd when still open
};

// Resolve filename (with username's home directory), open it and vet the
// descriptor: a regular file and, with a user, owned by that user and
// writable by no one else.  A file replaced by rename or chmodded meanwhile
// is simply the file that was opened.  Returns 0 (fd open, or -1 with
// open_errno when the vetted name could not be opened: the caller decides
// whether that is msg_open) or a code with the error recorded.
int32_t acl__open_aclfile(const char *filename, const char *username, const acl__textfile_opts &o,
                          acl__aclfile_s *f);
// The message for an ACL file that passed the lookup but could not be opened.
int32_t acl__open_failed(const acl__textfile_opts &o, const acl__aclfile_s &f);
// Read the opened file whole and close it (lock step included).
int32_t acl__read_aclfile(acl__aclfile_s *f, char **text, size_t *size);

struct acl__parse_result {
    int32_t lineno = 1;    // the line after the last one parsed
    size_t entries = 0;    // entries added to the trees
    bool clean = true;     // no fault was passed over
};
// Parse text (size bytes and a NUL, writable, cut in place) into trees.
// Returns 0 at the end of the text, or the code that stopped the parse: any
// fault without keep_going, and a memory failure always.
int32_t acl__parse_acltext(char *text, size_t size, const acl__textfile_opts &o, acl__text_sink &sink,
                           acl__trees_s *trees, acl__parse_result *res);

// Store a compiled ACL as the cache file of aclfname, atomically, with the
// ACL file's owner, group and mode.  0 written, 1 nothing to do, 37 failure.
int32_t sec__cache_aclbuffer(const char *aclfname, const sec_acl_buffer_desc *acl,
                             sec_boolean_t force);
// The same for the compiled ACL of `trees`, streamed to the file as it is
// serialised instead of built whole in memory first.
struct acl__trees_s;
int32_t acl__cache_acltrees(const char *aclfname, const acl__trees_s *trees, sec_boolean_t force);

// ---- Test seam between file operations ----------------------------------
//
// When set, the hook is called before each file operation of the cache
// writer and of the readers, with the step's name and the path it acts on,
// so tests can swap files, plant links or stop the process at that point.
// Steps:
//   cache:stat-acl   stat of the ACL file
//   cache:open       look at the cache name (no-follow, no access needed)
//   cache:open-write open an existing cache for writing (never written)
//   cache:open-tmp   exclusive creation of a temporary name (per attempt)
//   cache:write      each write to the temporary file
//   cache:fchown, cache:fchmod, cache:fsync, cache:close
//   cache:rename     rename of the temporary over the cache name
//   cache:unlink     removal of the temporary after a failure
//   read:open        a reader opening a file (called by the readers' owners)
//   read:fstat, read:read   inside acl__read_acl_file (read: per call)
// Not exported from the shared library; tests link the static one.
typedef void (*acl__file_step_hook_t)(const char *step, const char *path);
void acl__set_file_step_hook(acl__file_step_hook_t hook);

extern std::atomic<acl__file_step_hook_t> acl__file_step_hook;

// One relaxed load when no hook is set.
inline void acl__file_step(const char *step, const char *path) {
    acl__file_step_hook_t h = acl__file_step_hook.load(std::memory_order_relaxed);
    if (h) h(step, path);
}
