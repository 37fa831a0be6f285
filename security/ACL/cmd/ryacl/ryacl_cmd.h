// ryacl: the subcommands of the administrators' command and what they share.
// Each subcommand takes the arguments after its name (argv[0] is the
// subcommand's name) and returns the command's exit status.
#pragma once

#include <cstdio>

// Exit statuses shared by every subcommand.
#define RYACL_EXIT_OK 0       // clean, granted, same
#define RYACL_EXIT_FOUND 1    // faults found, nothing granted, different, busy
#define RYACL_EXIT_TROUBLE 2  // usage error, unreadable file, ...

int ryacl_cmd_check(int argc, char **argv);    // cmd_check.cpp
int ryacl_cmd_query(int argc, char **argv);    // cmd_query.cpp
int ryacl_cmd_list(int argc, char **argv);     // cmd_query.cpp
int ryacl_cmd_explain(int argc, char **argv);  // cmd_explain.cpp
int ryacl_cmd_diff(int argc, char **argv);     // cmd_diff.cpp
int ryacl_cmd_edit(int argc, char **argv);     // cmd_edit.cpp

// Check the ACL file at `path` as `ryacl check --format=text` does, printing
// its diagnostics to `out` under the name `display`.  Returns
// RYACL_EXIT_OK (clean), RYACL_EXIT_FOUND (faults printed) or
// RYACL_EXIT_TROUBLE (not read; the message, after "`display`: ", printed
// on standard error).
int ryacl_check_text(const char *path, const char *display, FILE *out);

// Compile the ACL file at `path` and store `path`.cacl exactly as
// `ryaclfck -s` would.  Returns RYACL_EXIT_OK or RYACL_EXIT_TROUBLE after
// printing the numbered message on standard error.
int ryacl_write_cache(const char *path);
