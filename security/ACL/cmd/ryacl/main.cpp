// ryacl: one command for the everyday jobs around ACL files.  This file
// only dispatches to the subcommands.
#include <locale.h>

#include <cstdio>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"

namespace {

struct subcommand {
    const char *name;
    int (*run)(int, char **);
};

constexpr subcommand kSubcommands[] = {
    {"check", ryacl_cmd_check}, {"query", ryacl_cmd_query}, {"list", ryacl_cmd_list},
    {"explain", ryacl_cmd_explain}, {"diff", ryacl_cmd_diff}, {"edit", ryacl_cmd_edit},
};

const char kUsage[] =
    "Usage: ryacl COMMAND [OPTION]... [ARG]...\n"
    "Try 'ryacl --help' for more information.\n";

const char kHelp[] =
    "Usage: ryacl COMMAND [OPTION]... [ARG]...\n"
    "Check, query and edit ACL files.\n"
    "\n"
    "Commands:\n"
    "  check    report every fault of ACL files, as text, gcc, json or sarif\n"
    "  query    show what an ACL file grants to one client\n"
    "  list     list the entries of an ACL file\n"
    "  explain  show the grant to one client and the entries that decided it\n"
    "  diff     show the entries added, removed and changed between two ACLs\n"
    "  edit     edit an ACL file safely, checking it before it is installed\n"
    "\n"
    "  -h, --help     show this help and exit\n"
    "  -V, --version  show the version and exit\n"
    "\n"
    "'ryacl COMMAND --help' describes one command.\n"
    "Exit status: 0 for success, 1 for a negative answer (faults, no match,\n"
    "differences, busy), 2 for trouble (usage, unreadable file).\n";

}  // namespace

int main(int argc, char **argv) {
    setlocale(LC_ALL, "");
    if (argc < 2) return ryacl_util::usage_error("no command given", kUsage);
    const char *cmd = argv[1];
    if (!std::strcmp(cmd, "--help") || !std::strcmp(cmd, "-h")) {
        std::fputs(kHelp, stdout);
        return ryacl_util::finish(RYACL_EXIT_OK);
    }
    if (!std::strcmp(cmd, "--version") || !std::strcmp(cmd, "-V")) {
        std::printf("ryacl %s\n", RYACL_VERSION);
        return ryacl_util::finish(RYACL_EXIT_OK);
    }
    for (const subcommand &s : kSubcommands)
        if (std::strcmp(cmd, s.name) == 0) return s.run(argc - 1, argv + 1);
    std::fprintf(stderr, "ryacl: '%s' is not a ryacl command\n%s", zo::escape_controls(cmd).c_str(), kUsage);
    return RYACL_EXIT_TROUBLE;
}
