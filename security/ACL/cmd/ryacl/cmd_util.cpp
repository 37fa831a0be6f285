// ryacl: escaping and framing shared by the subcommands' output.
#include <cstdio>

#include "ry_zo_int.h"
#include "ryacl_cmd.h"
#include "ryacl_cmd_util.h"

namespace ryacl_util {

std::string message_id(std::string_view message) {
    constexpr std::string_view kPrefix = "4471-";
    if (message.substr(0, kPrefix.size()) != kPrefix) return "";
    size_t end = kPrefix.size();
    while (end < message.size() && message[end] >= '0' && message[end] <= '9') ++end;
    return end > kPrefix.size() ? std::string(message.substr(0, end)) : "";
}

std::string escape_lines(std::string_view text) {
    std::string out;
    for (size_t at = 0;;) {
        const size_t nl = text.find('\n', at);
        out += zo::escape_controls(text.substr(at, nl == std::string_view::npos ? nl : nl - at));
        if (nl == std::string_view::npos) return out;
        out += '\n';
        at = nl + 1;
    }
}

namespace {

// Length of the well-formed UTF-8 sequence at s[i] (no overlong forms, no
// surrogates, nothing above U+10FFFF), or 0.
size_t utf8_length(std::string_view s, size_t i) {
    const auto b = [&](size_t k) { return static_cast<unsigned char>(s[k]); };
    const unsigned c = b(i);
    size_t n;
    unsigned lo = 0x80, hi = 0xbf;
    if (c >= 0xc2 && c <= 0xdf) n = 2;
    else if (c >= 0xe0 && c <= 0xef) n = 3, lo = c == 0xe0 ? 0xa0 : 0x80, hi = c == 0xed ? 0x9f : 0xbf;
    else if (c >= 0xf0 && c <= 0xf4) n = 4, lo = c == 0xf0 ? 0x90 : 0x80, hi = c == 0xf4 ? 0x8f : 0xbf;
    else return 0;
    if (i + n > s.size() || b(i + 1) < lo || b(i + 1) > hi) return 0;
    for (size_t k = 2; k < n; ++k)
        if (b(i + k) < 0x80 || b(i + k) > 0xbf) return 0;
    return n;
}

}  // namespace

std::string json_string(std::string_view s) {
    std::string out = "\"";
    char hex[8];
    for (size_t i = 0; i < s.size();) {
        const unsigned char c = static_cast<unsigned char>(s[i]);
        if (c == '"' || c == '\\') {
            out += '\\';
            out += static_cast<char>(c);
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\t') {
            out += "\\t";
        } else if (c < 0x20 || c == 0x7f) {
            std::snprintf(hex, sizeof hex, "\\u%04x", c);
            out += hex;
        } else if (c < 0x80) {
            out += static_cast<char>(c);
        } else if (const size_t n = utf8_length(s, i)) {
            out.append(s.substr(i, n));
            i += n;
            continue;
        } else {
            std::snprintf(hex, sizeof hex, "\\\\x%02x", c);
            out += hex;
        }
        ++i;
    }
    return out + "\"";
}

std::string file_uri(std::string_view path) {
    std::string out = !path.empty() && path[0] == '/' ? "file://" : "";
    char hex[4];
    for (const char ch : path) {
        const unsigned char c = static_cast<unsigned char>(ch);
        const bool keep = (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') ||
                          c == '-' || c == '.' || c == '_' || c == '~' || c == '/';
        if (keep) {
            out += ch;
        } else {
            std::snprintf(hex, sizeof hex, "%%%02X", c);
            out += hex;
        }
    }
    return out;
}

int usage_error(const char *what, const char *usage) {
    std::fprintf(stderr, "ryacl: %s\n%s", what, usage);
    return RYACL_EXIT_TROUBLE;
}

int unknown_option(const char *command, const char *arg, const char *usage) {
    std::fprintf(stderr, "ryacl %s: unknown option '%s'\n%s", command, zo::escape_controls(arg).c_str(), usage);
    return RYACL_EXIT_TROUBLE;
}

int finish(int status) {
    if (std::fflush(stdout) != 0 || std::ferror(stdout)) {
        std::perror("ryacl: standard output");
        return RYACL_EXIT_TROUBLE;
    }
    return status;
}

}  // namespace ryacl_util
