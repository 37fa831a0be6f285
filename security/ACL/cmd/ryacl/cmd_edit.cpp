// Placeholder until the subcommand lands.
#include "ryacl_cmd.h"

int ryacl_cmd_edit(int, char **) { return RYACL_EXIT_TROUBLE; }
