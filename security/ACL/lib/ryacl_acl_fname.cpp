// ACL file name resolution: an absolute name, a name relative to the current
// directory, or a simple name in a user's home directory, into the full path
// that every later step works on.
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "ryacl_acl_file.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"

namespace {

constexpr size_t kMaxPath = ACL_FNAME_AREA - 1;  // characters, without the NUL

// When the system suggests no size for password lookups, 16 KiB is ample
// for any entry a password database holds, and small enough to allocate.
constexpr long kDefaultPwSize = 16384;
// Growing past this is chasing a broken name service, not a real entry.
constexpr size_t kMaxPwSize = size_t{1} << 24;

// Append "/" (unless dir already ends with one) and name to the directory
// held in area (dlen characters).  The caller has checked that it fits.
void append_name(char *area, size_t dlen, const char *name, size_t nlen) {
    if (dlen == 0 || area[dlen - 1] != '/') area[dlen++] = '/';
    std::memcpy(area + dlen, name, nlen + 1);
}

// The user lookup beneath both operations.  fname is the file name that
// message 151 reports when the home directory does not fit the area.
int32_t lookup_user(const char *uname, uid_t *uid, char *hdir, const char *fname) {
    // An empty name is never a user, whatever a name service may answer.
    if (uname[0] == '\0') return acl::set_error(ACL_RC_UNKNOWN_USER, acl::msg::UNKNOWN_USER, uname);

    long suggested = static_cast<int32_t>(sysconf(_SC_GETPW_R_SIZE_MAX));
    if (suggested <= 0) suggested = kDefaultPwSize;
    size_t bufsize = 2 * static_cast<size_t>(suggested);
    char *buf = nullptr;
    struct passwd pwd;
    struct passwd *found = nullptr;
    int err;
    // The suggested size is only a hint: an entry with a long member list or
    // home directory needs more, and the lookup says so with ERANGE.
    for (;;) {
        buf = static_cast<char *>(acl__malloc(bufsize));
        if (!buf) return acl__no_memory("sec__get_user_info", bufsize);
        err = getpwnam_r(uname, &pwd, buf, bufsize, &found);
        if (err != ERANGE || bufsize >= kMaxPwSize) break;
        std::free(buf);
        bufsize *= 2;
    }

    int32_t rc = 0;
    if (err != 0 || !found || std::strncmp(found->pw_name, uname, static_cast<size_t>(suggested)) != 0) {
        rc = acl::set_error(ACL_RC_UNKNOWN_USER, acl::msg::UNKNOWN_USER, uname);
    } else {
        const char *home = found->pw_dir ? found->pw_dir : "";
        size_t hlen = std::strlen(home);
        if (hlen > kMaxPath) {
            // A home directory longer than the area leaves no room for any
            // file in it: the same report as a home plus name too long.
            rc = acl::set_error(ACL_RC_BAD_ARGS, acl::msg::FILE_NAME_WITH_USER, fname, uname);
        } else {
            std::memcpy(hdir, home, hlen + 1);
            *uid = found->pw_uid;
        }
    }
    std::free(buf);
    return rc;
}

}  // namespace

int32_t sec__get_user_info(const char *uname, uid_t *uid, char *hdir) {
    if (!uname) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_user_info", 1, 0);
    if (!uid) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_user_info", 2, 0);
    if (!hdir) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_user_info", 3, 0);
    // Called on its own there is no file name to report with a home
    // directory that does not fit; the empty text stands for it.
    return lookup_user(uname, uid, hdir, "");
}

int32_t sec__get_aclfname(const char *filename, const char *username, char *aclfname, uid_t *uid) {
    if (!filename) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_aclfname", 1, 0);
    if (!aclfname) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_aclfname", 3, 0);
    size_t nlen = std::strlen(filename);

    if (username) {
        if (!uid) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "sec__get_aclfname", 4, 0);
        // With a user the name must be a simple name in the home directory.
        if (std::strchr(filename, '/')) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::FILE_NAME_WITH_USER, filename, username);
        uid_t found_uid = 0;
        int32_t rc = lookup_user(username, &found_uid, aclfname, filename);
        if (rc != 0) return rc;
        size_t hlen = std::strlen(aclfname);
        // Counted with the separator even when the home ends with one.
        if (hlen + nlen + 1 > kMaxPath) return acl::set_error(ACL_RC_BAD_ARGS, acl::msg::FILE_NAME_WITH_USER, filename, username);
        append_name(aclfname, hlen, filename, nlen);
        *uid = found_uid;
        return 0;
    }

    if (filename[0] == '/') {
        // An absolute name that does not fit is reported as a path too long
        // for the area; there is no directory in play, so that is empty.
        if (nlen > kMaxPath) return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::CWD_TOO_LONG, "", filename);
        std::memcpy(aclfname, filename, nlen + 1);
        return 0;
    }

    if (!getcwd(aclfname, ACL_FNAME_AREA)) return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::NO_CWD, "getcwd()", errno);
    size_t dlen = std::strlen(aclfname);
    if (dlen + nlen + 1 > kMaxPath) return acl::set_error(ACL_RC_BAD_FILE_NAME, acl::msg::CWD_TOO_LONG, aclfname, filename);
    append_name(aclfname, dlen, filename, nlen);
    return 0;
}
