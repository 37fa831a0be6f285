// ryacl's writers for JSON and SARIF on arbitrary texts.  Input: one byte
// giving the length of a file name, the name, then a message text.
//
// A document built as `ryacl check --format=json` builds its fault entries
// (file name, message id, message, and the file's URI as SARIF writes it)
// must parse back as JSON: valid UTF-8 throughout, no raw control
// character, every escape one JSON knows.  Each string must read back as
// what it was given, but for bytes that are not UTF-8, which read back as
// the text \xNN.  The id is the message's "4471-" number or empty, the URI
// percent-decodes to the name, and the escaped lines keep their line breaks
// and tabs and lose every other control character.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "ryacl_cmd_util.h"

namespace {

[[noreturn]] void fail(const char *what) {
    std::fprintf(stderr, "fuzz_ryacl_json: %s\n", what);
    std::abort();
}
void expect(bool ok, const char *what) {
    if (!ok) fail(what);
}

// Length of the UTF-8 sequence at s[i], decoded to its code point and
// measured against the shortest form: 0 when it is not well formed.
size_t utf8_at(std::string_view s, size_t i) {
    const unsigned c = static_cast<unsigned char>(s[i]);
    size_t n = c < 0x80 ? 1 : (c >> 5) == 6 ? 2 : (c >> 4) == 14 ? 3 : (c >> 3) == 30 ? 4 : 0;
    if (n == 0 || i + n > s.size()) return 0;
    uint32_t cp = n == 1 ? c : c & (0x7f >> n);
    for (size_t k = 1; k < n; ++k) {
        const unsigned t = static_cast<unsigned char>(s[i + k]);
        if ((t & 0xc0) != 0x80) return 0;
        cp = cp << 6 | (t & 0x3f);
    }
    static const uint32_t kMin[] = {0, 0, 0x80, 0x800, 0x10000};
    if (cp < kMin[n] || cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff)) return 0;
    return n;
}

// What a string written with json_string must read back as.
std::string expected(std::string_view s) {
    std::string out;
    char hex[8];
    for (size_t i = 0; i < s.size();) {
        if (const size_t n = utf8_at(s, i)) {
            out.append(s.substr(i, n));
            i += n;
        } else {
            std::snprintf(hex, sizeof hex, "\\x%02x", static_cast<unsigned char>(s[i]));
            out += hex;
            ++i;
        }
    }
    return out;
}

// A strict reader of the documents built below: an object whose values are
// strings.  Fails the input on anything that is not JSON.
struct reader {
    std::string_view d;
    size_t at = 0;

    void space() {
        while (at < d.size() && (d[at] == ' ' || d[at] == '\n' || d[at] == '\t' || d[at] == '\r')) ++at;
    }
    void take(char c) {
        space();
        expect(at < d.size() && d[at] == c, "punctuation where JSON has it");
        ++at;
    }
    static int hexval(char c) {
        if (c >= '0' && c <= '9') return c - '0';
        if (c >= 'a' && c <= 'f') return c - 'a' + 10;
        if (c >= 'A' && c <= 'F') return c - 'A' + 10;
        fail("a hexadecimal digit in \\u");
    }
    std::string string() {
        take('"');
        std::string out;
        for (;;) {
            expect(at < d.size(), "a string closed");
            const unsigned char c = static_cast<unsigned char>(d[at]);
            if (c == '"') {
                ++at;
                return out;
            }
            expect(c >= 0x20, "no raw control character in a string");
            if (c != '\\') {
                const size_t n = utf8_at(d, at);
                expect(n != 0, "UTF-8 in a string");
                out.append(d.substr(at, n));
                at += n;
                continue;
            }
            expect(++at < d.size(), "an escape completed");
            switch (d[at++]) {
            case '"': out += '"'; break;
            case '\\': out += '\\'; break;
            case '/': out += '/'; break;
            case 'b': out += '\b'; break;
            case 'f': out += '\f'; break;
            case 'n': out += '\n'; break;
            case 'r': out += '\r'; break;
            case 't': out += '\t'; break;
            case 'u': {
                expect(at + 4 <= d.size(), "four digits after \\u");
                unsigned cp = 0;
                for (int k = 0; k < 4; ++k) cp = cp << 4 | hexval(d[at++]);
                // The writer escapes control characters only.
                expect(cp < 0x80, "\\u only for ASCII");
                out += static_cast<char>(cp);
                break;
            }
            default: fail("an escape that JSON knows");
            }
        }
    }
};

std::string percent_decoded(std::string_view s) {
    std::string out;
    for (size_t i = 0; i < s.size(); ++i) {
        if (s[i] != '%') {
            out += s[i];
            continue;
        }
        expect(i + 2 < s.size(), "two digits after %");
        out += static_cast<char>(reader::hexval(s[i + 1]) << 4 | reader::hexval(s[i + 2]));
        i += 2;
    }
    return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 1) return 0;
    const size_t split = data[0] < size - 1 ? data[0] : size - 1;
    const std::string_view file(reinterpret_cast<const char *>(data + 1), split);
    const std::string_view message(reinterpret_cast<const char *>(data + 1 + split), size - 1 - split);
    using namespace ryacl_util;

    const std::string id = message_id(message);
    const std::string uri = file_uri(file);
    const std::string shown = escape_lines(message);
    const std::string doc = "{\"file\": " + json_string(file) + ", \"uri\": " + json_string(uri) +
                            ", \"id\": " + json_string(id) + ", \"message\": " + json_string(message) +
                            ", \"shown\": " + json_string(shown) + "}\n";

    reader r{doc};
    std::vector<std::string> values;
    static const char *const kKeys[] = {"file", "uri", "id", "message", "shown"};
    r.take('{');
    for (const char *key : kKeys) {
        if (key != kKeys[0]) r.take(',');
        expect(r.string() == key, "the keys as written");
        r.take(':');
        values.push_back(r.string());
    }
    r.take('}');
    r.space();
    expect(r.at == doc.size(), "nothing after the document");

    expect(values[0] == expected(file), "the file name reads back");
    expect(values[1] == uri, "the URI reads back");
    expect(values[2] == id, "the id reads back");
    expect(values[3] == expected(message), "the message reads back");
    expect(values[4] == expected(shown), "the escaped lines read back");

    const bool numbered = message.size() > 5 && message.substr(0, 5) == "4471-" && message[5] >= '0' && message[5] <= '9';
    expect(id.empty() != numbered, "an id exactly when the message is numbered");
    expect(message.substr(0, id.size()) == id, "the id leads the message");
    expect(id.size() <= 5 || id.find_first_not_of("0123456789", 5) == std::string::npos, "the id's number");
    expect(id.size() == message.size() || id.empty() || message[id.size()] < '0' || message[id.size()] > '9',
           "the id takes every digit");

    std::string_view path = uri;
    if (!file.empty() && file[0] == '/') {
        expect(path.substr(0, 7) == "file://", "an absolute name as a file: URI");
        path.remove_prefix(7);
    }
    expect(path.find_first_not_of("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-._~/%") ==
               std::string_view::npos,
           "a URI of unreserved characters");
    expect(percent_decoded(path) == file, "the URI decodes to the name");

    size_t breaks = 0;
    for (const char c : message) breaks += c == '\n';
    size_t shown_breaks = 0;
    for (const char c : shown) {
        const unsigned char u = static_cast<unsigned char>(c);
        expect(c == '\n' || c == '\t' || (u >= 0x20 && u != 0x7f), "no control character left in a line");
        shown_breaks += c == '\n';
    }
    expect(shown_breaks == breaks, "every line break kept");
    return 0;
}
