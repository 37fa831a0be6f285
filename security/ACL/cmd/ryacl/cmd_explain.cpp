// Placeholder until the subcommand lands.
#include "ryacl_cmd.h"

int ryacl_cmd_explain(int, char **) { return RYACL_EXIT_TROUBLE; }
