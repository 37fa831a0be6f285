// ryacl: one command for the everyday jobs around ACL files.  This file
// only dispatches to the subcommands.
#include <locale.h>

#include <cstdio>
#include <cstring>

#include "ryacl_cmd.h"

namespace {

struct subcommand {
    const char *name;
    int (*run)(int, char **);
};

constexpr subcommand kSubcommands[] = {
    {"check", ryacl_cmd_check}, {"query", ryacl_cmd_query}, {"list", ryacl_cmd_list},
    {"explain", ryacl_cmd_explain}, {"diff", ryacl_cmd_diff}, {"edit", ryacl_cmd_edit},
};

}  // namespace

int main(int argc, char **argv) {
    setlocale(LC_ALL, "");
    if (argc < 2) {
        fputs("Usage: ryacl COMMAND [ARG]...\n", stderr);
        return RYACL_EXIT_TROUBLE;
    }
    for (const subcommand &s : kSubcommands)
        if (strcmp(argv[1], s.name) == 0) return s.run(argc - 1, argv + 1);
    fprintf(stderr, "ryacl: '%s' is not a ryacl command.\n", argv[1]);
    return RYACL_EXIT_TROUBLE;
}
