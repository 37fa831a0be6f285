// ryaclfck's run control: options, their settling, the check.
//
// Everything the command prints goes to standard error through the error
// facility, so that every line can come from the message catalog; nothing
// is written to standard output.
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "aclfck.h"
#include "ryacl.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"

namespace {

enum run_status { RUN_GO = 0, RUN_HELP = 1, RUN_USAGE = ACL_RC_BAD_ARGS, RUN_NO_MEMORY = ACL_RC_NO_MEMORY };

void report() { acl::report_current_error(stderr, true); }

// Print a warning or notice and drop it, so the check starts with an empty
// error slot.
void warn(int32_t rc, int32_t msgnum) {
    acl::set_error(rc, msgnum);
    report();
    acl::clear_error();
}

struct settings {
    char *aclfname = nullptr;
    char *username = nullptr;
    char *ptplname = nullptr;
    uint32_t flags = 0;
    ~settings() {
        std::free(aclfname);
        std::free(username);
        std::free(ptplname);
    }
};

// Copy an option argument into *slot.  Goes through the library's
// allocation path so tests can make it fail.
int copy_arg(char **slot, const char *arg) {
    char *copy = acl__strdup(arg);
    if (!copy) {
        acl__no_memory("main", std::strlen(arg) + 1);
        return RUN_NO_MEMORY;
    }
    *slot = copy;
    return RUN_GO;
}

}  // namespace

int aclfck__main(int argc, char **argv) {
    settings s;
    int status = RUN_GO;
    bool recorded = false;

    // opterr stays on: the parser's own complaint names the offending
    // letter, which message 147 does not.
    int c;
    while ((c = getopt(argc, argv, "cf:hsSt:u:v")) != -1) {
        uint32_t bit = 0;
        char **slot = nullptr;
        switch (c) {
        case 'c': bit = ACLFCK_CONTINUE; break;
        case 'h': bit = ACLFCK_HELP; break;
        case 's': bit = ACLFCK_CACHE; break;
        case 'S': bit = ACLFCK_STREAM; break;
        case 'v': bit = ACLFCK_VERBOSE; break;
        case 'f': slot = &s.aclfname; break;
        case 't': slot = &s.ptplname; break;
        case 'u': slot = &s.username; break;
        default:  // '?': unknown letter or missing argument
            acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_OPTION);
            status = RUN_USAGE;
            recorded = true;
            continue;
        }
        if ((bit && (s.flags & bit)) || (slot && *slot)) {
            const char opt[3] = {'-', static_cast<char>(c), '\0'};
            acl::set_error(ACL_RC_BAD_ARGS, acl::msg::OPTION_REPEATED, opt);
            status = RUN_USAGE;
            recorded = true;
            continue;
        }
        if (bit) {
            s.flags |= bit;
            if (bit == ACLFCK_HELP) status = RUN_HELP;
        } else if (copy_arg(slot, optarg) != RUN_GO) {
            status = RUN_NO_MEMORY;
            recorded = true;
        }
    }

    if (status != RUN_GO) {
        if (!recorded) {
            // -h alone (possibly with other valid options): help, nothing else.
            acl::set_error(ACL_RC_BAD_ARGS, acl::msg::HELP);
            report();
            return 0;
        }
        report();  // only the last recorded error survives
        if (status == RUN_USAGE) {
            acl::set_error(ACL_RC_BAD_ARGS, acl::msg::USAGE);
            report();
            return ACL_RC_BAD_ARGS;
        }
        return status == RUN_NO_MEMORY ? ACL_RC_NO_MEMORY : 0;
    }

    if (!s.aclfname) {
        acl::set_error(ACL_RC_BAD_ARGS, acl::msg::NO_FILE_OPTION);
        report();
        acl::set_error(ACL_RC_BAD_ARGS, acl::msg::USAGE);
        report();
        return ACL_RC_BAD_ARGS;
    }
    if (s.ptplname && (s.flags & ACLFCK_VERBOSE)) warn(ACL_RC_NOT_IMPLEMENTED, 149);
    if (s.flags & ACLFCK_STREAM) {
        if (s.flags & ACLFCK_VERBOSE) warn(ACL_RC_NOT_IMPLEMENTED, 149);
        s.flags &= ~ACLFCK_STREAM;  // the check always runs in bulk mode
    }
    if (s.username && (s.flags & ACLFCK_CACHE)) {
        s.flags &= ~ACLFCK_CACHE;
        warn(ACL_RC_INFO, 150);
    }
    return aclfck__bulk_aclfile(s.aclfname, s.username, s.flags);
}
