// ryacl check: every fault of every file named, with its line, as text,
// compiler-style lines, JSON or SARIF.  The check itself is the checker's
// (aclfck__check under -c), so both commands always hold one opinion.
#include <getopt.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "aclfck.h"
#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_tree.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"
#include "ryacl_error.h"

namespace {

enum class format { text, gcc, json, sarif };

struct diagnostic {
    int32_t line;
    int32_t rc;
    std::string id;       // "4471-179"
    std::string message;  // the whole formatted text, as the checker prints it
};

struct file_report {
    std::string file;  // as named on the command line
    bool read = true;  // false: not read or vetted (`trouble` says why)
    std::string trouble;
    size_t entries = 0;
    std::vector<diagnostic> diags;
};

const char kUsage[] =
    "Usage: ryacl check [--format=text|gcc|json|sarif] [--user=NAME] [--cache] FILE...\n"
    "Try 'ryacl check --help' for more information.\n";

const char kHelp[] =
    "Usage: ryacl check [OPTION]... FILE...\n"
    "Check ACL files and report every fault with its line ('-' reads standard input).\n"
    "\n"
    "  -f, --format=FORMAT  text (default), gcc, json or sarif\n"
    "  -u, --user=NAME      FILE is a simple name in the home directory of NAME,\n"
    "                       who must own it; only NAME may write it\n"
    "  -c, --cache          store FILE.cacl for each file without faults\n"
    "  -h, --help           show this help and exit\n"
    "\n"
    "Exit status: 0 when every file is clean, 1 when a file has a fault,\n"
    "2 for wrong usage or a file that could not be read.\n";

// The current error as one diagnostic.  Its printed id leads its text; a
// translation without one falls back on the default text's.
diagnostic current_diagnostic(int32_t rc, int32_t line) {
    diagnostic d{line, rc, "", ""};
    zo_error_t *rec = nullptr;
    char *text = nullptr;
    int32_t msgnum = 0;
    if (zo_get_error_1(&rec) == 0 && rec) {
        msgnum = rec->zo_msg_num;
        if (zo_get_errmsg_1(rec, &text) == 0 && text) d.message = text;
    }
    zo_rel_errmsg_1(text);
    zo_rel_error_1(rec);
    d.id = ryacl_util::message_id(d.message);
    if (d.id.empty()) d.id = ryacl_util::message_id(acl::msg_text(msgnum));
    return d;
}

// Collects what the checker meets in one file.
struct collect_sink final : acl__text_sink {
    file_report &r;
    explicit collect_sink(file_report &rep) : r(rep) {}
    void fault(int32_t rc, int32_t line) override {
        if (line > 0) {
            r.diags.push_back(current_diagnostic(rc, line));
        } else if (rc != ACL_RC_INFO) {  // notices ("not cached") are no trouble
            r.read = false;
            r.trouble = current_diagnostic(rc, 0).message;
        }
    }
};

// Standard input read whole, then parsed like a file's text.
void check_stdin(file_report &r) {
    std::string text;
    char buf[65536];
    for (;;) {
        const ssize_t n = read(0, buf, sizeof buf);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            r.read = false;
            r.trouble = std::string("ryacl: standard input: ") + std::strerror(errno) + "\n";
            return;
        }
        if (n == 0) break;
        text.append(buf, static_cast<size_t>(n));
    }
    if (text.empty()) return;
    acl__textfile_opts o{ACL_RC_BAD_FILE_NAME, acl::msg::CHECK_FILE_BAD.num, acl::msg::CHECK_FILE_NOT_OWNED.num,
                         acl::msg::CHECK_FILE_OPEN.num};
    o.keep_going = true;
    o.permset = &acl__default_perm_set;
    o.trees_borrow_text = true;  // the trees go before the text
    collect_sink sink(r);
    acl__trees_s trees;
    acl__parse_result res;
    (void)acl__parse_acltext(text.data(), text.size(), o, sink, &trees, &res);
    acl__free_trees(&trees);
    r.entries = res.entries;
}

file_report check_one(const char *file, const char *user, bool cache) {
    file_report r;
    r.file = file;
    if (std::strcmp(file, "-") == 0) {
        check_stdin(r);
        return r;
    }
    collect_sink sink(r);
    acl__parse_result res;
    const int32_t rc = aclfck__check(file, user, ACLFCK_CONTINUE | (cache ? ACLFCK_CACHE : 0u), sink, &res);
    // A memory failure ends the check with a line of its own; the file was
    // not checked whole.
    if (rc != 0 && r.read) {
        r.read = false;
        r.trouble = r.diags.empty() ? current_diagnostic(rc, 0).message : r.diags.back().message;
    }
    r.entries = res.entries;
    return r;
}

std::string first_line(const std::string &s) { return s.substr(0, s.find('\n')); }

// "FILE:LINE: " before every line of the message, the message as the
// checker prints it (its own blank line after it).
void print_text(FILE *out, const file_report &r) {
    const std::string file = zo::escape_controls(r.file);
    for (const diagnostic &d : r.diags)
        std::fprintf(out, "%s:%d: %s\n", file.c_str(), static_cast<int>(d.line), ryacl_util::escape_lines(d.message).c_str());
}

void print_gcc(FILE *out, const file_report &r) {
    const std::string file = zo::escape_controls(r.file);
    for (const diagnostic &d : r.diags) {
        std::string head = first_line(d.message);
        if (head.compare(0, d.id.size(), d.id) == 0) head.erase(0, d.id.size());
        while (!head.empty() && head[0] == ' ') head.erase(0, 1);
        std::fprintf(out, "%s:%d: %s: %s %s\n", file.c_str(), static_cast<int>(d.line),
                     d.rc == ACL_RC_INFO ? "warning" : "error", d.id.c_str(), zo::escape_controls(head).c_str());
    }
}

const char *severity(const diagnostic &d) { return d.rc == ACL_RC_INFO ? "warning" : "error"; }

int id_number(const std::string &id) { return std::atoi(id.c_str() + id.find('-') + 1); }

void print_json(FILE *out, const std::vector<file_report> &reports) {
    using ryacl_util::json_string;
    std::string s = "{\"version\": 1, \"files\": [";
    for (size_t i = 0; i < reports.size(); ++i) {
        const file_report &r = reports[i];
        s += i ? ", " : "";
        s += "{\"file\": " + json_string(r.file) + ", \"ok\": " + (r.read && r.diags.empty() ? "true" : "false") +
             ", \"entries\": " + std::to_string(r.entries);
        if (!r.read) s += ", \"error\": " + json_string(r.trouble);
        s += ", \"diagnostics\": [";
        for (size_t k = 0; k < r.diags.size(); ++k) {
            const diagnostic &d = r.diags[k];
            s += k ? ", " : "";
            s += "{\"line\": " + std::to_string(d.line) + ", \"id\": " + json_string(d.id) +
                 ", \"number\": " + std::to_string(id_number(d.id)) + ", \"rc\": " + std::to_string(d.rc) +
                 ", \"severity\": \"" + severity(d) + "\", \"message\": " + json_string(d.message) + "}";
        }
        s += "]}";
    }
    s += "]}\n";
    std::fputs(s.c_str(), out);
}

void print_sarif(FILE *out, const std::vector<file_report> &reports) {
    using ryacl_util::json_string;
    std::map<std::string, size_t> rule_index;
    std::string rules, results, notes;
    for (const file_report &r : reports) {
        const std::string uri = json_string(ryacl_util::file_uri(r.file));
        if (!r.read) {
            notes += notes.empty() ? "" : ", ";
            notes += "{\"level\": \"error\", \"message\": {\"text\": " + json_string(r.trouble) +
                     "}, \"locations\": [{\"physicalLocation\": {\"artifactLocation\": {\"uri\": " + uri + "}}}]}";
        }
        for (const diagnostic &d : r.diags) {
            auto [it, added] = rule_index.emplace(d.id, rule_index.size());
            if (added) {
                rules += it->second ? ", " : "";
                rules += "{\"id\": " + json_string(d.id) + ", \"shortDescription\": {\"text\": " +
                         json_string(first_line(d.message)) + "}}";
            }
            results += results.empty() ? "" : ", ";
            results += "{\"ruleId\": " + json_string(d.id) + ", \"ruleIndex\": " + std::to_string(it->second) +
                       ", \"level\": \"" + severity(d) + "\", \"message\": {\"text\": " + json_string(d.message) +
                       "}, \"locations\": [{\"physicalLocation\": {\"artifactLocation\": {\"uri\": " + uri +
                       "}, \"region\": {\"startLine\": " + std::to_string(d.line) + "}}}]}";
        }
    }
    std::string s = "{\"$schema\": \"https://json.schemastore.org/sarif-2.1.0.json\", \"version\": \"2.1.0\", "
                    "\"runs\": [{\"tool\": {\"driver\": {\"name\": \"ryacl\", \"version\": \"" RYACL_VERSION
                    "\", \"rules\": [" + rules + "]}}, \"invocations\": [{\"executionSuccessful\": " +
                    (notes.empty() ? "true" : "false") + ", \"toolExecutionNotifications\": [" + notes +
                    "]}], \"results\": [" + results + "]}]}\n";
    std::fputs(s.c_str(), out);
}

int status_of(const file_report &r) {
    if (!r.read) return RYACL_EXIT_TROUBLE;
    return r.diags.empty() ? RYACL_EXIT_OK : RYACL_EXIT_FOUND;
}

// A file that could not be read: its message on standard error, naming it.
void print_trouble(const file_report &r) {
    if (!r.read)
        std::fprintf(stderr, "%s: %s\n", zo::escape_controls(r.file).c_str(), ryacl_util::escape_lines(r.trouble).c_str());
}

}  // namespace

int ryacl_check_text(const char *path, const char *display, FILE *out) {
    file_report r = check_one(path, nullptr, false);
    r.file = display;
    print_text(out, r);
    print_trouble(r);
    return status_of(r);
}

int ryacl_write_cache(const char *path) {
    return aclfck__bulk_aclfile(path, nullptr, ACLFCK_CACHE) == 0 ? RYACL_EXIT_OK : RYACL_EXIT_TROUBLE;
}

int ryacl_cmd_check(int argc, char **argv) {
    static const option kLong[] = {
        {"format", required_argument, nullptr, 'f'}, {"user", required_argument, nullptr, 'u'},
        {"cache", no_argument, nullptr, 'c'},        {"help", no_argument, nullptr, 'h'},
        {nullptr, 0, nullptr, 0},
    };
    format fmt = format::text;
    const char *user = nullptr;
    bool cache = false;
    optind = 0;  // a fresh scan of the subcommand's arguments
    int c;
    while ((c = getopt_long(argc, argv, "+f:u:ch", kLong, nullptr)) != -1) {
        switch (c) {
        case 'f':
            if (!std::strcmp(optarg, "text")) fmt = format::text;
            else if (!std::strcmp(optarg, "gcc")) fmt = format::gcc;
            else if (!std::strcmp(optarg, "json")) fmt = format::json;
            else if (!std::strcmp(optarg, "sarif")) fmt = format::sarif;
            else {
                // Appended, not `"'" + text`: g++ 12 warns falsely (-Wrestrict) on that form.
                std::string why = zo::escape_controls(optarg);
                why.insert(0, 1, '\'');
                why += "' is not a format";
                return ryacl_util::usage_error(why.c_str(), kUsage);
            }
            break;
        case 'u':
            if (user) return ryacl_util::usage_error("--user given more than once", kUsage);
            user = optarg;
            break;
        case 'c': cache = true; break;
        case 'h': std::fputs(kHelp, stdout); return RYACL_EXIT_OK;
        default: std::fputs(kUsage, stderr); return RYACL_EXIT_TROUBLE;  // getopt has complained
        }
    }
    if (optind >= argc) return ryacl_util::usage_error("no ACL file given", kUsage);
    if (user && cache) {
        // The checker's rule: a user's file is never cached.
        acl::set_error(ACL_RC_INFO, acl::msg::SAVE_IGNORED_WITH_USER);
        acl::report_current_error(stderr, true);
        acl::clear_error();
        cache = false;
    }

    int status = RYACL_EXIT_OK;
    std::vector<file_report> kept;  // JSON and SARIF are written at the end
    for (int i = optind; i < argc; ++i) {
        file_report r = check_one(argv[i], user, cache);
        print_trouble(r);
        const int s = status_of(r);
        if (s > status) status = s;
        if (fmt == format::text) print_text(stdout, r);
        else if (fmt == format::gcc) print_gcc(stdout, r);
        else kept.push_back(std::move(r));
    }
    if (fmt == format::json) print_json(stdout, kept);
    else if (fmt == format::sarif) print_sarif(stdout, kept);
    return ryacl_util::finish(status);
}
