// Placeholder until the subcommand lands.
#include "ryacl_cmd.h"

int ryacl_cmd_query(int, char **) { return RYACL_EXIT_TROUBLE; }
int ryacl_cmd_list(int, char **) { return RYACL_EXIT_TROUBLE; }
