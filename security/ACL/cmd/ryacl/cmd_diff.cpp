// ryacl diff: who gains and who loses what between two ACL files.  Entries
// are matched by type, mechanism and identity without regard to letter
// case (one hash probe each); order, spacing and comments do not count.
#include <getopt.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "acl_load.h"
#include "acl_match.h"
#include "ry_zo_int.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"

namespace {

using ryacl::acl_item;
using ryacl::loaded_acl;

const char kUsage[] = "Usage: ryacl diff [--format=text|json] OLD NEW\n";

const char kHelp[] =
    "Usage: ryacl diff [--format=text|json] OLD NEW\n"
    "Show who gains and who loses what between two ACL files.\n"
    "\n"
    "OLD and NEW are ACL text files or compiled ACLs (cache files), in any\n"
    "mix; a compiled ACL is recognised by its first bytes and validated.\n"
    "Entries are matched by type, mechanism and identity without regard to\n"
    "letter case; order, spacing and comments do not count.\n"
    "\n"
    "  --format=text   one line per difference (the default):\n"
    "                    + ENTRY                       added in NEW\n"
    "                    - ENTRY                       removed from OLD\n"
    "                    ~ ENTRY OLDLETTERS -> NEWLETTERS  permissions changed\n"
    "                  ENTRY is written as in an ACL file (\"u unix alice rw\";\n"
    "                  without letters after ~), \"-\" stands for no letters,\n"
    "                  and a changed entry is spelt as in NEW\n"
    "  --format=json   one JSON document: {\"version\": 1, \"old\": FILE,\n"
    "                  \"new\": FILE, \"same\": BOOL, \"added\": N, \"removed\": N,\n"
    "                  \"changed\": N, \"differences\": [{\"change\": \"added\"|\n"
    "                  \"removed\"|\"changed\", \"type\": \"user\", \"mech\": M,\n"
    "                  \"id\": ID, \"old\": LETTERS, \"new\": LETTERS}, ...]}\n"
    "                  (\"mech\" and \"id\" only where the type has them, \"old\"\n"
    "                  and \"new\" only where the entry exists)\n"
    "  -h, --help      show this help and exit\n"
    "\n"
    "Differences are listed by type (n, o, u, e, g), then by mechanism, then\n"
    "by identity, ignoring letter case.  A permission bit without a letter\n"
    "shows as the mask in hexadecimal.  Control characters from the files\n"
    "are written as \\xNN.\n"
    "\n"
    "Exit status: 0 when the two grant the same, 1 when they differ, 2 on\n"
    "trouble (unreadable or faulty file, wrong usage).\n";

enum class change { added, removed, changed };

struct difference {
    change kind;
    const acl_item *old_e;  // null when added
    const acl_item *new_e;  // null when removed
    const acl_item &shown() const { return new_e ? *new_e : *old_e; }
};

int type_rank(unsigned char t) { return t; }  // n 1, o 2, u 4, e 8, g 16

bool before(const difference &a, const difference &b) {
    const acl_item &x = a.shown(), &y = b.shown();
    if (x.type != y.type) return type_rank(x.type) < type_rank(y.type);
    if (int c = zo_strcasecmp_posix_1(x.mech, y.mech)) return c < 0;
    if (x.idlen || y.idlen) {
        if (int c = zo::casecmp_len(x.id ? x.id : "", x.idlen, y.id ? y.id : "", y.idlen)) return c < 0;
        if (int c = std::memcmp(x.id, y.id, std::min(x.idlen, y.idlen))) return c < 0;
    }
    return a.kind < b.kind;
}

std::string letters_or_dash(uint32_t perm) {
    std::string s = ryacl::perm_letters(perm);
    return s.empty() ? "-" : s;
}

void print_text(const std::vector<difference> &diffs) {
    std::string buf;
    for (const difference &d : diffs) {
        const acl_item &e = d.shown();
        switch (d.kind) {
        case change::added: buf += "+ " + ryacl::entry_text(e); break;
        case change::removed: buf += "- " + ryacl::entry_text(e); break;
        case change::changed:
            buf += "~ " + ryacl::entry_text(e, false) + ' ' + letters_or_dash(d.old_e->perm) + " -> " +
                   letters_or_dash(d.new_e->perm);
            break;
        }
        buf = zo::escape_controls(buf);
        buf += '\n';
        std::fwrite(buf.data(), 1, buf.size(), stdout);
        buf.clear();
    }
}

void print_json(const std::vector<difference> &diffs, const loaded_acl &o, const loaded_acl &n) {
    size_t count[3] = {0, 0, 0};
    for (const difference &d : diffs) ++count[static_cast<int>(d.kind)];
    using ryacl_util::json_string;
    std::string out = "{\"version\": 1, \"old\": " + json_string(o.path) + ", \"new\": " + json_string(n.path);
    out += diffs.empty() ? ", \"same\": true" : ", \"same\": false";
    out += ", \"added\": " + std::to_string(count[0]) + ", \"removed\": " + std::to_string(count[1]) +
           ", \"changed\": " + std::to_string(count[2]) + ", \"differences\": [";
    static const char *const kinds[] = {"added", "removed", "changed"};
    bool first = true;
    for (const difference &d : diffs) {
        const acl_item &e = d.shown();
        out += first ? "\n  " : ",\n  ";
        first = false;
        out += std::string("{\"change\": \"") + kinds[static_cast<int>(d.kind)] + "\", \"type\": \"" +
               ryacl::type_word(e.type) + '"';
        if (e.mech[0]) {
            out += ", \"mech\": " + json_string(e.mech);
        }
        if (e.id) {
            out += ", \"id\": " + json_string(std::string_view(e.id, e.idlen));
        }
        if (d.old_e) out += ", \"old\": \"" + ryacl::perm_letters(d.old_e->perm) + '"';
        if (d.new_e) out += ", \"new\": \"" + ryacl::perm_letters(d.new_e->perm) + '"';
        out += '}';
        if (out.size() > (1u << 16)) {
            std::fwrite(out.data(), 1, out.size(), stdout);
            out.clear();
        }
    }
    out += first ? "]}\n" : "\n]}\n";
    std::fwrite(out.data(), 1, out.size(), stdout);
}

// 0 and the differences, or the return code of a refusal (recorded).
int32_t compare(const loaded_acl &o, const loaded_acl &n, std::vector<difference> &diffs) {
    ryacl::entry_matcher m(o, n);
    if (int32_t rc = m.run()) return rc;
    for (size_t i = 0; i < o.items.size(); ++i) {
        const uint32_t j = m.old_match[i];
        if (j == ryacl::entry_matcher::kShadowed) continue;
        if (j == ryacl::entry_matcher::kNone) diffs.push_back({change::removed, &o.items[i], nullptr});
        else if (m.old_changed[i])
            diffs.push_back({change::changed, &o.items[i], &n.items[j - 1]});
    }
    for (size_t j = 0; j < n.items.size(); ++j)
        if (!m.new_done[j]) diffs.push_back({change::added, nullptr, &n.items[j]});
    std::sort(diffs.begin(), diffs.end(), before);
    return 0;
}

int run_diff(int argc, char **argv) {
    static const option longopts[] = {
        {"format", required_argument, nullptr, 'f'}, {"help", no_argument, nullptr, 'h'}, {nullptr, 0, nullptr, 0}};
    bool json = false;
    optind = 1;
    opterr = 0;
    for (int c; (c = getopt_long(argc, argv, "+h", longopts, nullptr)) != -1;) {
        switch (c) {
        case 'h': std::fputs(kHelp, stdout); return RYACL_EXIT_OK;
        case 'f':
            if (std::strcmp(optarg, "json") == 0) json = true;
            else if (std::strcmp(optarg, "text") == 0) json = false;
            else {
                std::fprintf(stderr, "ryacl diff: unknown format '%s'\n%s", zo::escape_controls(optarg).c_str(), kUsage);
                return RYACL_EXIT_TROUBLE;
            }
            break;
        default: return ryacl_util::unknown_option("diff", argv[optind - 1], kUsage);
        }
    }
    if (argc - optind != 2) {
        std::fputs(kUsage, stderr);
        return RYACL_EXIT_TROUBLE;
    }
    loaded_acl o, n;
    // The matching screens both files for duplicates in the same pass.
    if (!ryacl::load_acl_file(argv[optind], false, o, false) || !ryacl::load_acl_file(argv[optind + 1], false, n, false))
        return RYACL_EXIT_TROUBLE;
    std::vector<difference> diffs;
    if (compare(o, n, diffs) != 0) {
        ryacl::print_error();
        return RYACL_EXIT_TROUBLE;
    }
    if (json) print_json(diffs, o, n);
    else print_text(diffs);
    return ryacl_util::finish(diffs.empty() ? RYACL_EXIT_OK : RYACL_EXIT_FOUND);
}

}  // namespace

int ryacl_cmd_diff(int argc, char **argv) {
    return ryacl::out_of_memory_guard("diff", [&] { return run_diff(argc, argv); });
}
