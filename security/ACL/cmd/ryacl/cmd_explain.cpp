// ryacl explain: what an ACL grants to one client and why: the entry or
// entries that decided it, with their line numbers, or what was searched
// and not found.  The walk is the library's evaluation step for step (first
// sub-ACL of the type and mechanism; user and group walks end at the first
// entry that orders after the name), so the grant is the one a service gets.
#include <getopt.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "acl_load.h"
#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"
#include "ryacl_error.h"

namespace {

using ryacl::acl_item;
using ryacl::acl_sub;
using ryacl::loaded_acl;

const char kUsage[] =
    "Usage: ryacl explain [--text] SELECTOR FILE\n"
    "Try 'ryacl explain --help' for more information.\n";

const char kHelp[] =
    "Usage: ryacl explain [--text] SELECTOR FILE\n"
    "Show what the ACL file FILE grants to a client, and which entries\n"
    "decided it.\n"
    "\n"
    "Selectors (give exactly one):\n"
    "  --identity=MECH:ID    the user ID of the mechanism MECH\n"
    "  --expanded=MECH:ID    the expanded identity ID of MECH\n"
    "  --groups=G1,G2,...    a member of these groups (their grants combine)\n"
    "  --anyother            any other authenticated client\n"
    "  --unauthenticated     an unauthenticated client\n"
    "\n"
    "  -t, --text            read the text file even when its cache file\n"
    "                        FILE.cacl is current\n"
    "  -h, --help            show this help and exit\n"
    "\n"
    "FILE is read as the library reads it: from FILE.cacl when that is newer\n"
    "than FILE and has its owner, group and mode (the output says so; a cache\n"
    "file has no line numbers), else from the text.  MECH:ID is split at the\n"
    "first colon.  Identities and groups are compared without regard to case;\n"
    "expanded identities are matched the same way (a service may register its\n"
    "own rule for them).\n"
    "\n"
    "The first line is \"grant: LETTERS (0xMASK)\", or \"grant: none\" when no\n"
    "entry applies; \"-\" stands for an entry that grants no letters.  Then\n"
    "each deciding entry as it stands in an ACL file, with its line number,\n"
    "or what was searched and not found; last the file read (\"read from:\").\n"
    "Control characters are written as \\xNN.\n"
    "\n"
    "Exit status: 0 when an entry applies (the library grants its letters,\n"
    "even none), 1 when no entry applies, 2 on trouble (unreadable or\n"
    "faulty file, wrong usage).\n";

enum class selector { none, identity, expanded, groups, anyother, unauthenticated };

int usage_error(const std::string &what) {
    std::fprintf(stderr, "ryacl explain: %s\n%s", zo::escape_controls(what).c_str(), kUsage);
    return RYACL_EXIT_TROUBLE;
}

std::string show(const std::string &s) { return zo::escape_controls(s); }

// Where an entry stands, and the entry.
std::string where(const acl_item &e) {
    std::string at = e.line ? "line " + std::to_string(e.line) : std::string("cache file");
    return at + ": " + show(ryacl::entry_text(e));
}

int cmp(const std::string &name, const acl_item &e) {
    return zo::casecmp_len(name.c_str(), name.size(), e.id ? e.id : "", e.idlen);
}

const acl_sub *find_sub(const std::vector<acl_sub> &subs, unsigned char type,
                        const std::string &mech) {
    const bool named = type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_EXPANDED;
    for (const acl_sub &s : subs)
        if (s.type == type && (!named || zo_strcasecmp_posix_1(mech.c_str(), s.mech) == 0)) return &s;
    return nullptr;
}

std::string grant_line(uint32_t perm) {
    std::string l = ryacl::perm_letters(perm);
    char mask[16];
    std::snprintf(mask, sizeof mask, "0x%08x", perm);
    return "grant: " + (l.empty() ? std::string("-") : l) + " (" + mask + ")\n";
}

struct request {
    selector sel = selector::none;
    std::string mech, id;
    std::vector<std::string> groups;
};

int explain(const loaded_acl &acl, const request &rq) {
    const std::vector<acl_sub> subs = acl.subs();
    std::string out;
    int status = RYACL_EXIT_OK;
    switch (rq.sel) {
    case selector::anyother:
    case selector::unauthenticated: {
        const unsigned char type = rq.sel == selector::anyother ? SEC_ACLE_TYPE_ANYOTHER : SEC_ACLE_TYPE_UNAUTHENTICATED;
        const acl_sub *s = find_sub(subs, type, "");
        if (!s || s->items.empty()) {
            out = std::string("grant: none\nno entry matched: the ACL has no ") + ryacl::type_word(type) + " entry\n";
            status = RYACL_EXIT_FOUND;
            break;
        }
        const acl_item &e = acl.items[s->items.front()];
        out = grant_line(e.perm) + "decided by " + where(e) + "\n";
        break;
    }
    case selector::identity:
    case selector::expanded: {
        const bool user = rq.sel == selector::identity;
        const unsigned char type = user ? SEC_ACLE_TYPE_USER : SEC_ACLE_TYPE_EXPANDED;
        const acl_sub *s = find_sub(subs, type, rq.mech);
        if (!s) {
            out = std::string("grant: none\nno entry matched: the ACL has no ") + ryacl::type_word(type) +
                  " entries of mechanism " + show(rq.mech) + "\n";
            status = RYACL_EXIT_FOUND;
            break;
        }
        const acl_item *hit = nullptr;
        size_t searched = 0;
        for (uint32_t i : s->items) {
            ++searched;
            const int c = cmp(rq.id, acl.items[i]);
            if (c == 0) {
                hit = &acl.items[i];
                break;
            }
            // User entries lie in ascending order: the library stops here.
            if (c < 0 && user) break;
        }
        if (!hit) {
            out = std::string("grant: none\nno entry matched: the ") + ryacl::type_word(type) + " entries of mechanism " +
                  show(s->mech) + " (" + std::to_string(s->items.size()) + " entries, " + std::to_string(searched) +
                  " searched) hold no identity " + show(rq.id) + "\n";
            status = RYACL_EXIT_FOUND;
            break;
        }
        out = grant_line(hit->perm) + "decided by " + where(*hit) + "\n";
        break;
    }
    case selector::groups: {
        const acl_sub *s = find_sub(subs, SEC_ACLE_TYPE_GROUP, "");
        if (!s) {
            out = "grant: none\nno entry matched: the ACL has no group entries\n";
            status = RYACL_EXIT_FOUND;
            break;
        }
        uint32_t perm = 0;
        bool any = false;
        std::string lines;
        for (const std::string &g : rq.groups) {
            const acl_item *hit = nullptr;
            for (uint32_t i : s->items) {
                const int c = cmp(g, acl.items[i]);
                if (c == 0) hit = &acl.items[i];
                if (c <= 0) break;
            }
            if (hit) {
                perm |= hit->perm;
                any = true;
                lines += "group " + show(g) + ": " + where(*hit) + "\n";
            } else {
                lines += "group " + show(g) + ": no entry\n";
            }
        }
        if (!any) {
            out = "grant: none\nno entry matched: the group entries (" + std::to_string(s->items.size()) +
                  ") name none of the groups\n" + lines;
            status = RYACL_EXIT_FOUND;
            break;
        }
        out = grant_line(perm) + lines;
        break;
    }
    case selector::none: break;
    }
    std::fputs(out.c_str(), stdout);
    return status;
}

bool split_identity(const char *arg, request &rq) {
    const char *colon = std::strchr(arg, ':');
    if (!colon || colon == arg || !colon[1]) return false;
    rq.mech.assign(arg, static_cast<size_t>(colon - arg));
    rq.id.assign(colon + 1);
    return true;
}

bool split_groups(const char *arg, request &rq) {
    std::string all = arg;
    for (size_t start = 0;;) {
        const size_t comma = all.find(',', start);
        rq.groups.push_back(all.substr(start, comma == std::string::npos ? comma : comma - start));
        if (rq.groups.back().empty()) return false;
        if (comma == std::string::npos) return true;
        start = comma + 1;
    }
}

int run_explain(int argc, char **argv) {
    enum { kIdentity = 256, kExpanded, kGroups, kAnyother, kUnauth };
    static const option longopts[] = {{"identity", required_argument, nullptr, kIdentity},
                                      {"expanded", required_argument, nullptr, kExpanded},
                                      {"groups", required_argument, nullptr, kGroups},
                                      {"anyother", no_argument, nullptr, kAnyother},
                                      {"unauthenticated", no_argument, nullptr, kUnauth},
                                      {"text", no_argument, nullptr, 't'},
                                      {"help", no_argument, nullptr, 'h'},
                                      {nullptr, 0, nullptr, 0}};
    request rq;
    bool text = false;
    optind = 1;
    opterr = 0;
    for (int c; (c = getopt_long(argc, argv, "+th", longopts, nullptr)) != -1;) {
        if (c == 'h') {
            std::fputs(kHelp, stdout);
            return RYACL_EXIT_OK;
        }
        if (c == 't') {
            text = true;
            continue;
        }
        if (c == '?' || c == ':') return usage_error(std::string("unknown option or missing argument: ") + argv[optind - 1]);
        if (rq.sel != selector::none) return usage_error("give exactly one selector");
        switch (c) {
        case kIdentity:
        case kExpanded:
            rq.sel = c == kIdentity ? selector::identity : selector::expanded;
            if (!split_identity(optarg, rq)) return usage_error(std::string("not MECH:ID: ") + optarg);
            break;
        case kGroups:
            rq.sel = selector::groups;
            if (!split_groups(optarg, rq)) return usage_error(std::string("an empty group name: ") + optarg);
            break;
        case kAnyother: rq.sel = selector::anyother; break;
        default: rq.sel = selector::unauthenticated; break;
        }
    }
    if (rq.sel == selector::none) return usage_error("no selector given");
    if (argc - optind != 1) return usage_error("give one ACL file");
    const char *file = argv[optind];

    loaded_acl acl;
    if (!text) {
        // The library's own choice between the cache and the text.
        sec_buffer_desc buf{0, nullptr};
        uint32_t rflags = 0;
        int32_t rc = sec_read_acl_file(file, nullptr, nullptr, SEC_ACLF_CONVERT_CACHE, &buf, &rflags);
        if (rc) {
            ryacl::print_error();
            return RYACL_EXIT_TROUBLE;
        }
        const bool cached = buf.length > 0 && !(rflags & SEC_ACLF_FROM_TEXT);
        bool ok = true;
        if (cached) ok = ryacl::load_acl_buffer(buf, std::string(file) + ".cacl", acl);
        sec_release_acl(&buf);
        if (!ok) return RYACL_EXIT_TROUBLE;
        text = !cached;
    }
    if (text && !ryacl::load_acl_file(file, true, acl)) return RYACL_EXIT_TROUBLE;
    const int status = explain(acl, rq);
    std::printf("read from: %s (%s)\n", show(acl.path).c_str(), acl.compiled ? "cache file, current" : "text");
    return ryacl_util::finish(status);
}

}  // namespace

int ryacl_cmd_explain(int argc, char **argv) {
    return ryacl::out_of_memory_guard("explain", [&] { return run_explain(argc, argv); });
}
