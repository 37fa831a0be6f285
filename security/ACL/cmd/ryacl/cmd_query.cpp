// ryacl query and ryacl list: what an ACL file grants to one client, and
// its entries.  They use only the public interface (ryacl.h, ry_zo.h), so
// they see the library exactly as a service linking libryacl does.
#include <getopt.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"

namespace {

enum class query { none, unauthenticated, anyother, identity, expanded, groups, list };

struct options {
    bool listing = false;  // ryacl list: the query is fixed
    const char *user = nullptr;
    uint32_t flags = 0;
    bool verbose = false;
    query q = query::none;
    std::string mech, id;             // --identity, --expanded
    std::vector<std::string> groups;  // --groups
    const char *file = nullptr;
};

const char kUsage[] =
    "Usage: ryacl query [OPTION]... QUERY FILE\n"
    "Try 'ryacl query --help' for more information.\n";

const char kListUsage[] =
    "Usage: ryacl list [OPTION]... FILE\n"
    "Try 'ryacl list --help' for more information.\n";

// The options for reading FILE, alike in query's and list's help.
#define READING_OPTIONS \
    "  -u, --user=NAME          FILE is a simple name in the home directory of\n" \
    "                           NAME, who must own it; only NAME may write it\n" \
    "  -t, --from-text          ignore the cache file FILE.cacl, compile the text\n" \
    "  -w, --write-cache        store FILE.cacl after compiling the text\n" \
    "  -C, --verify-cache       validate FILE.cacl before using it; when it is\n" \
    "                           refused, compile the text instead\n" \
    "  -v, --verbose            tell on standard error where the ACL came from\n" \
    "  -h, --help               show this help and exit\n"

const char kHelp[] =
    "Usage: ryacl query [OPTION]... QUERY FILE\n"
    "Show what the ACL file FILE grants to a client.\n"
    "\n"
    "Queries (give exactly one):\n"
    "  -n, --unauthenticated    grant to an unauthenticated client\n"
    "  -o, --anyother           grant to any other authenticated client\n"
    "  -i, --identity=MECH:ID   grant to the user ID of the mechanism MECH\n"
    "  -e, --expanded=MECH:ID   grant to the expanded identity ID of MECH\n"
    "  -g, --groups=G1[,G2...]  combined grant to a member of these groups\n"
    "  -l, --list               list every entry, one line each, in the\n"
    "                           ACL file format (as 'ryacl list')\n"
    "\n"
    "Reading FILE:\n"
    READING_OPTIONS
    "  -V, --version            show the version and exit\n"
    "\n"
    "A grant is printed as permission letters and as a mask, for example\n"
    "\"rwx 0x0000000b\"; \"-\" stands for no letters.  MECH:ID is split at the\n"
    "first colon.  Identities and groups are compared without regard to case;\n"
    "ryacl matches expanded identities the same way (a service may register\n"
    "its own rule for them).  When no entry of the kind asked for applies,\n"
    "the library's message 4471-147 is printed and the exit status is 1.\n"
    "\n"
    "Exit status: 0 when the question was answered, 1 when no entry applies,\n"
    "2 for wrong usage or when the library failed (its message on standard\n"
    "error).\n";

const char kListHelp[] =
    "Usage: ryacl list [OPTION]... FILE\n"
    "List every entry of the ACL file FILE, one line each, in the ACL file\n"
    "format, the mask as a comment.\n"
    "\n"
    READING_OPTIONS
    "\n"
    "Exit status: 0 when listed, 2 for wrong usage or when the library failed\n"
    "(its message on standard error).\n";

// The report sequence of the checker: fetch the current error, format it in
// the user's language, print it, release both.
void report_current_error(const char *what, int32_t rc) {
    zo_error_t *rec = nullptr;
    char *text = nullptr;
    if (zo_get_error_1(&rec) == 0 && rec && zo_get_errmsg_1(rec, &text) == 0 && text) {
        std::fprintf(stderr, "%s\n", text);
    } else {
        // Only when the slot is empty or memory ran out: still say something.
        std::fprintf(stderr, "ryacl: %s failed with return code %d\n", what, static_cast<int>(rc));
    }
    zo_rel_errmsg_1(text);
    zo_rel_error_1(rec);
}

// An evaluation that finds no entry of the kind asked for (43) is a
// negative answer; every other failure is trouble.
int exit_status(int32_t rc) { return rc == ACL_RC_BAD_ACLE ? RYACL_EXIT_FOUND : RYACL_EXIT_TROUBLE; }

// ASCII only, so the answer does not depend on the caller's locale; the
// library compares user entries the same way.
int32_t casecmp_posix(const char *a, const char *b) {
    for (;; ++a, ++b) {
        unsigned ca = static_cast<unsigned char>(*a), cb = static_cast<unsigned char>(*b);
        if (ca >= 'A' && ca <= 'Z') ca += 'a' - 'A';
        if (cb >= 'A' && cb <= 'Z') cb += 'a' - 'A';
        if (ca != cb || ca == 0) return static_cast<int32_t>(ca) - static_cast<int32_t>(cb);
    }
}

// Without a registered handler no expanded entry can ever match, so the
// question would have no useful answer.  A service registers its own rule;
// ours is the one the library applies to user entries.
int32_t expanded_handler(const char *client_id, const char *entry_id) {
    return casecmp_posix(client_id, entry_id);
}

// Letters and mask on one line.  A bit without a permission template (only a
// compiled ACL made with another template set has one) shows as "?" beside
// the exact mask, with the library's message as a warning.
std::string grant_text(uint32_t mask) {
    char letters[33] = {0};
    if (sec_translate_bitmask(mask, nullptr, letters) != 0) {
        report_current_error("sec_translate_bitmask", ACL_RC_PERMISSION);
        zo_set_no_error_1();
        std::strcpy(letters, "?");
    }
    char line[64];
    std::snprintf(line, sizeof line, "%s 0x%08x", letters[0] ? letters : "-", mask);
    return line;
}

// MECH:ID split at the first colon: identities may hold colons (IPv6
// registry names), mechanisms do not.
bool split_identity(const char *subject, std::string &mech, std::string &id) {
    const char *colon = std::strchr(subject, ':');
    if (!colon) return false;
    mech.assign(subject, static_cast<size_t>(colon - subject));
    id.assign(colon + 1);
    return true;
}

// G1,G2,...: every name non-empty.
bool split_groups(const char *subject, std::vector<std::string> &groups) {
    std::string all = subject;
    size_t start = 0;
    for (;;) {
        size_t comma = all.find(',', start);
        groups.push_back(all.substr(start, comma == std::string::npos ? comma : comma - start));
        if (groups.back().empty()) return false;
        if (comma == std::string::npos) break;
        start = comma + 1;
    }
    // The library counts groups in an int32_t.
    return groups.size() <= static_cast<size_t>(INT32_MAX);
}

// Arguments echoed in a complaint are the user's bytes: escaped.
std::string zo_what(const std::string &what) { return zo::escape_controls(what); }

int usage_error(const options &o, const std::string &what) {
    return ryacl_util::usage_error(zo_what(what).c_str(), o.listing ? kListUsage : kUsage);
}

int parse_options(int argc, char **argv, options &o) {
    static const option kLong[] = {
        {"unauthenticated", no_argument, nullptr, 'n'},
        {"anyother", no_argument, nullptr, 'o'},
        {"identity", required_argument, nullptr, 'i'},
        {"expanded", required_argument, nullptr, 'e'},
        {"groups", required_argument, nullptr, 'g'},
        {"list", no_argument, nullptr, 'l'},
        {"user", required_argument, nullptr, 'u'},
        {"from-text", no_argument, nullptr, 't'},
        {"write-cache", no_argument, nullptr, 'w'},
        {"verify-cache", no_argument, nullptr, 'C'},
        {"verbose", no_argument, nullptr, 'v'},
        {"help", no_argument, nullptr, 'h'},
        {nullptr, 0, nullptr, 0},
    };
    // ryacl list takes only the options about reading the file.
    const option *longopts = o.listing ? kLong + 6 : kLong;
    const char *shortopts = o.listing ? "+u:twCvh" : "+noi:e:g:lu:twCvh";
    if (o.listing) o.q = query::list;
    optind = 0;  // a fresh scan of the subcommand's arguments
    int c;
    while ((c = getopt_long(argc, argv, shortopts, longopts, nullptr)) != -1) {
        query q = query::none;
        switch (c) {
        case 'n': q = query::unauthenticated; break;
        case 'o': q = query::anyother; break;
        case 'i': q = query::identity; break;
        case 'e': q = query::expanded; break;
        case 'g': q = query::groups; break;
        case 'l': q = query::list; break;
        case 'u':
            if (o.user) return usage_error(o, "--user given more than once");
            o.user = optarg;
            break;
        case 't': o.flags |= SEC_ACLF_FROM_TEXT; break;
        case 'w': o.flags |= SEC_ACLF_WRITE_CACHE; break;
        case 'C': o.flags |= SEC_ACLF_CONVERT_CACHE; break;
        case 'v': o.verbose = true; break;
        case 'h': std::fputs(o.listing ? kListHelp : kHelp, stdout); return -1;
        default:  // getopt has complained
            std::fputs(o.listing ? kListUsage : kUsage, stderr);
            return RYACL_EXIT_TROUBLE;
        }
        if (q != query::none) {
            // One question per run keeps the output a single answer.
            if (o.q != query::none) return usage_error(o, "give only one query");
            o.q = q;
            if ((q == query::identity || q == query::expanded) && !split_identity(optarg, o.mech, o.id))
                return usage_error(o, std::string("'") + optarg + "' is not MECH:ID");
            if (q == query::groups && !split_groups(optarg, o.groups))
                return usage_error(o, std::string("'") + optarg + "' is not a list of group names");
        }
    }
    if (o.q == query::none) return usage_error(o, "no query given");
    if (optind >= argc) return usage_error(o, "no ACL file given");
    if (optind + 1 < argc) return usage_error(o, std::string("unexpected argument '") + argv[optind + 1] + "'");
    o.file = argv[optind];
    return 0;
}

void tell_source(uint32_t rflags) {
    if (!(rflags & SEC_ACLF_FROM_TEXT)) {
        std::fprintf(stderr, "ryacl: the ACL came from the cache file%s\n",
                     (rflags & SEC_ACLF_CONVERT_CACHE) ? ", which passed validation" : "");
    } else {
        std::fprintf(stderr, "ryacl: the ACL was compiled from the text; cache file %s\n",
                     (rflags & SEC_ACLF_WRITE_CACHE) ? "written" : "not written");
    }
}

int list_entries(sec_acl_buffer_t acl) {
    sec_acle_list_desc list = {0, nullptr};
    int32_t rc = sec_list_acl(acl, &list);
    if (rc != 0) {
        report_current_error("sec_list_acl", rc);
        return RYACL_EXIT_TROUBLE;
    }
    // The lines are valid ACL text again: the mask follows as a comment, and
    // an untranslatable mask ("?") makes the line fail a later check loudly
    // instead of granting something else.
    for (int32_t i = 0; i < list.count; ++i) {
        const sec_acle_desc *e = list.acles[i];
        std::string grant = grant_text(e->perm);
        std::string letters = grant.substr(0, grant.find(' '));
        std::string mask = grant.substr(grant.find(' ') + 1);
        std::string line;
        switch (e->type) {
        case SEC_ACLE_TYPE_UNAUTHENTICATED: line = "n"; break;
        case SEC_ACLE_TYPE_ANYOTHER: line = "o"; break;
        case SEC_ACLE_TYPE_USER: line = std::string("u ") + e->mech + " " + (e->id ? e->id : ""); break;
        case SEC_ACLE_TYPE_EXPANDED: line = std::string("e ") + e->mech + " " + (e->id ? e->id : ""); break;
        case SEC_ACLE_TYPE_GROUP: line = std::string("g ") + (e->id ? e->id : ""); break;
        default: line = "? type " + std::to_string(e->type); break;
        }
        if (letters != "-") line += " " + letters;
        std::printf("%s # %s\n", line.c_str(), mask.c_str());
    }
    sec_release_aclelist(&list);
    return 0;
}

int evaluate(const options &o, sec_acl_index_t acl) {
    uint32_t perm = 0;
    int32_t rc = 0;
    const char *what = "sec_index_single_acle_perm";
    switch (o.q) {
    case query::unauthenticated:
        rc = sec_index_single_acle_perm(acl, SEC_ACLE_TYPE_UNAUTHENTICATED, nullptr, nullptr, nullptr, &perm);
        break;
    case query::anyother:
        rc = sec_index_single_acle_perm(acl, SEC_ACLE_TYPE_ANYOTHER, nullptr, nullptr, nullptr, &perm);
        break;
    case query::identity:
        rc = sec_index_single_acle_perm(acl, SEC_ACLE_TYPE_USER, o.mech.c_str(), nullptr, o.id.c_str(), &perm);
        break;
    case query::expanded:
        // An empty or over-long mechanism is refused here, with the
        // library's own message.
        what = "sec__register_id_handler";
        rc = sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, o.mech.c_str(), expanded_handler);
        if (rc == 0) {
            what = "sec_index_single_acle_perm";
            rc = sec_index_single_acle_perm(acl, SEC_ACLE_TYPE_EXPANDED, o.mech.c_str(), nullptr, o.id.c_str(),
                                            &perm);
        }
        break;
    case query::groups: {
        what = "sec_index_group_acles_perm";
        std::vector<sec_buffer_desc> groups(o.groups.size());
        for (size_t i = 0; i < groups.size(); ++i) {
            groups[i].length = 0;  // not read: the names are NUL-terminated
            groups[i].value = const_cast<char *>(o.groups[i].c_str());
        }
        rc = sec_index_group_acles_perm(acl, static_cast<int32_t>(groups.size()), groups.data(), &perm);
        break;
    }
    default:
        return usage_error(o, "no query given");
    }
    if (rc != 0) {
        report_current_error(what, rc);
        return exit_status(rc);
    }
    std::printf("%s\n", grant_text(perm).c_str());
    return 0;
}

int run(options &o, int argc, char **argv) {
    int status = parse_options(argc, argv, o);
    if (status != 0) return status < 0 ? 0 : status;

    sec_acl_buffer_desc acl = {0, nullptr};
    uint32_t rflags = 0;
    int32_t rc = sec_read_acl_file(o.file, o.user, nullptr, o.flags, &acl, &rflags);
    if (rc != 0) {
        report_current_error("sec_read_acl_file", rc);
        return RYACL_EXIT_TROUBLE;  // a duplicate entry (43) too: the file is at fault
    }
    if (o.verbose) {
        if (acl.length == 0)  // no cache file is ever empty: this was the text
            std::fputs("ryacl: the ACL file holds no entries\n", stderr);
        else
            tell_source(rflags);
    }

    // A file without entries yields no compiled ACL; an empty one answers
    // every question the way an ACL without such an entry does.
    if (acl.length == 0) rc = sec_create_empty_acl(&acl);
    // Never evaluate bytes nobody validated: without --verify-cache a cache
    // file is returned as it stands, and a damaged one must give an error,
    // not a grant.
    // A buffer in the other byte order is converted without being checked;
    // the second call then checks it.
    if (rc == 0) rc = sec_convert_acl_to_host(1, &acl);
    if (rc == 0) rc = sec_convert_acl_to_host(1, &acl);
    if (rc != 0) {
        report_current_error("sec_convert_acl_to_host", rc);
        // A block whose type byte was damaged is refused by sec_release_acl
        // but is still ours: the library hands out malloc blocks.
        if (sec_release_acl(&acl) != 0) std::free(acl.value);
        return RYACL_EXIT_TROUBLE;
    }

    if (o.q == query::list) {
        status = list_entries(&acl);
    } else {
        // Evaluated as a service evaluates: through an index of the ACL.
        sec_acl_index_t index = nullptr;
        rc = sec_create_acl_index(&acl, &index);
        if (rc != 0) {
            report_current_error("sec_create_acl_index", rc);
            sec_release_acl(&acl);
            return RYACL_EXIT_TROUBLE;
        }
        status = evaluate(o, index);
        sec_release_acl_index(index);
    }
    sec_release_acl(&acl);
    return ryacl_util::finish(status);
}

int run_guarded(bool listing, int argc, char **argv) {
    try {
        options o;
        o.listing = listing;
        return run(o, argc, argv);
    } catch (const std::bad_alloc &) {
        std::fputs("ryacl: out of memory\n", stderr);
        return RYACL_EXIT_TROUBLE;
    }
}

}  // namespace

int ryacl_cmd_query(int argc, char **argv) { return run_guarded(false, argc, argv); }
int ryacl_cmd_list(int argc, char **argv) { return run_guarded(true, argc, argv); }
