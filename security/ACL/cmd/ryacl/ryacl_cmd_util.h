// ryacl: small helpers the subcommands share for what they print.
#pragma once

#include <string>
#include <string_view>

namespace ryacl_util {

// The printed id ("4471-179") that leads a message's text, or "".
std::string message_id(std::string_view message);
// Control characters of every line escaped as \xNN; the line breaks kept.
std::string escape_lines(std::string_view text);
// A JSON string literal, quotes included.  Bytes that are not UTF-8 are
// written as the text \xNN, so the document stays valid JSON.
std::string json_string(std::string_view s);
// A file name as a URI reference: relative names as relative references,
// absolute ones as file: URIs, everything but unreserved characters and
// '/' percent-encoded.
std::string file_uri(std::string_view path);

// "ryacl: WHAT" and the usage text on standard error; the usage status.
int usage_error(const char *what, const char *usage);
// "ryacl COMMAND: unknown option 'ARG'" (ARG's control characters
// escaped), then the usage, on standard error; returns RYACL_EXIT_TROUBLE.
int unknown_option(const char *command, const char *arg, const char *usage);
// Flush standard output: a failed write is trouble, not success.
int finish(int status);

}  // namespace ryacl_util
