// Placeholder until the subcommand lands.
#include "ryacl_cmd.h"

int ryacl_cmd_check(int, char **) { return RYACL_EXIT_TROUBLE; }
int ryacl_check_text(const char *, const char *, FILE *) { return RYACL_EXIT_TROUBLE; }
int ryacl_write_cache(const char *) { return RYACL_EXIT_TROUBLE; }
