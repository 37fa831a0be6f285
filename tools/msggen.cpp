// msggen: turn the gencat source of the message catalog into the C table of
// default texts, so that the catalog and the built-in texts never disagree,
// and into a header naming every message with the kinds of its arguments.
//
//   msggen SOURCE.msg OUTPUT.cpp OUTPUT.h
//
// Understands the subset of the gencat syntax the source uses: "$set N",
// "$quote C", "$ comment" lines, and "NUMBER TEXT" messages (quoted or not)
// with the escapes \n \t \v \b \r \f \\ \" and \ooo, continued onto the next
// line by a trailing backslash.  Only set 1 is taken.  Each message of set 1
// has a name: a comment line "$ NAME" (upper case, digits, underscores)
// right above it, which gencat skips like any comment.
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>

namespace {

constexpr int kSlots = 623;

[[noreturn]] void die(const std::string &file, int line, const std::string &why) {
    std::cerr << file << ":" << line << ": " << why << "\n";
    std::exit(1);
}

// Decode the text of one message (after the number), quotes removed.
std::string decode(const std::string &raw, char quote, const std::string &file, int line) {
    std::string s = raw;
    if (quote && !s.empty() && s.front() == quote) {
        if (s.size() < 2 || s.back() != quote) die(file, line, "unterminated quoted message");
        s = s.substr(1, s.size() - 2);
    }
    std::string out;
    for (size_t i = 0; i < s.size(); ++i) {
        char c = s[i];
        if (c != '\\') {
            if (quote && c == quote) die(file, line, "unescaped quote inside a message");
            out += c;
            continue;
        }
        if (++i == s.size()) die(file, line, "dangling backslash");
        char e = s[i];
        switch (e) {
        case 'n': out += '\n'; break;
        case 't': out += '\t'; break;
        case 'v': out += '\v'; break;
        case 'b': out += '\b'; break;
        case 'r': out += '\r'; break;
        case 'f': out += '\f'; break;
        case '\\': out += '\\'; break;
        default:
            if (e >= '0' && e <= '7') {
                int v = 0, n = 0;
                while (n < 3 && i < s.size() && s[i] >= '0' && s[i] <= '7') v = v * 8 + (s[i++] - '0'), ++n;
                --i;
                out += static_cast<char>(v);
            } else if (quote && e == quote) {
                out += e;
            } else {
                die(file, line, std::string("unknown escape \\") + e);
            }
        }
    }
    return out;
}

// The kinds of a message's arguments, one letter per placeholder position
// the text uses, in ascending order of position (the order in which callers
// pass the values; a text may skip a position): 's' for a text ("%N$s"),
// 'n' for a number ("%N$d", "%N$x", "%N$08x", "%N$c").
std::string arg_kinds(const std::string &text, const std::string &file, int line) {
    static const std::regex placeholder(R"(%([0-9]+)\$[0-9]*([a-z]))");
    std::map<int, char> kinds;
    for (std::sregex_iterator it(text.begin(), text.end(), placeholder), end; it != end; ++it) {
        const int pos = std::stoi((*it)[1]);
        const char conv = (*it)[2].str()[0];
        const char kind = conv == 's' ? 's' : 'n';
        if (conv != 's' && conv != 'd' && conv != 'x' && conv != 'c') die(file, line, "unknown conversion");
        auto [at, fresh] = kinds.emplace(pos, kind);
        if (!fresh && at->second != kind) die(file, line, "one position used as a text and as a number");
    }
    std::string out;
    for (const auto &[pos, kind] : kinds) out += kind;
    return out;
}

std::string c_literal(const std::string &s) {
    std::string out = "\"";
    for (unsigned char c : s) {
        switch (c) {
        case '\n': out += "\\n\"\n    \""; break;
        case '\t': out += "\\t"; break;
        case '\\': out += "\\\\"; break;
        case '"': out += "\\\""; break;
        default:
            if (c < 0x20 || c >= 0x7f) {
                char buf[8];
                std::snprintf(buf, sizeof buf, "\\%03o", c);
                out += buf;
            } else {
                out += static_cast<char>(c);
            }
        }
    }
    return out + "\"";
}

// Write only when the content changes, to keep rebuilds quiet.
bool write_if_changed(const char *path, const std::string &content) {
    {
        std::ifstream old(path, std::ios::binary);
        std::stringstream cur;
        cur << old.rdbuf();
        if (old && cur.str() == content) return true;
    }
    std::ofstream o(path, std::ios::binary | std::ios::trunc);
    o << content;
    return static_cast<bool>(o);
}

}  // namespace

int main(int argc, char **argv) {
    if (argc != 4) {
        std::cerr << "usage: msggen SOURCE.msg OUTPUT.cpp OUTPUT.h\n";
        return 2;
    }
    const std::string file = argv[1];
    std::ifstream in(file, std::ios::binary);
    if (!in) die(file, 0, "cannot open");

    std::map<int, std::string> texts;
    std::map<int, std::string> names;
    std::set<std::string> taken;
    std::string pending_name;  // from a "$ NAME" line, for the next message
    static const std::regex name_line(R"(\$[ \t]+([A-Z][A-Z0-9_]*)[ \t]*)");
    char quote = 0;
    int set = 0, lineno = 0;
    std::string line;
    while (std::getline(in, line)) {
        ++lineno;
        int first = lineno;
        // Join continuation lines: a trailing backslash that is not itself
        // escaped continues the message on the next line.
        while (!line.empty() && line.back() == '\\') {
            size_t n = 0;
            for (size_t i = line.size(); i > 0 && line[i - 1] == '\\'; --i) ++n;
            if (n % 2 == 0) break;
            std::string next;
            if (!std::getline(in, next)) die(file, lineno, "continuation at end of file");
            ++lineno;
            line.pop_back();
            line += next;
        }
        if (line.empty()) continue;
        if (line[0] == '$') {
            std::smatch m;
            if (std::regex_match(line, m, name_line)) {
                if (!pending_name.empty()) die(file, first, "two names for one message");
                pending_name = m[1];
                continue;
            }
            std::istringstream ss(line.substr(1));
            std::string kw;
            ss >> kw;
            if (kw == "set") {
                ss >> set;
            } else if (kw == "quote") {
                std::string q;
                ss >> q;
                quote = q.empty() ? 0 : q[0];
            }
            continue;  // "$ comment" and other directives
        }
        size_t i = 0;
        while (i < line.size() && line[i] >= '0' && line[i] <= '9') ++i;
        if (i == 0) die(file, first, "message line does not start with a number");
        int num = std::atoi(line.substr(0, i).c_str());
        if (i < line.size() && line[i] != ' ' && line[i] != '\t') die(file, first, "bad separator");
        std::string raw = i < line.size() ? line.substr(i + 1) : "";
        std::string name;
        name.swap(pending_name);
        if (set != 1) continue;
        if (num < 0 || num >= kSlots) die(file, first, "message number outside the table");
        if (texts.count(num)) die(file, first, "message number given twice");
        if (name.empty()) die(file, first, "message without a \"$ NAME\" line above it");
        if (!taken.insert(name).second) die(file, first, "name " + name + " given twice");
        texts[num] = decode(raw, quote, file, first);
        names[num] = name + " " + arg_kinds(texts[num], file, first);
    }
    if (!pending_name.empty()) die(file, lineno, "a name with no message below it");

    std::ostringstream out;
    out << "// Generated by msggen from ryseclib_msg.msg.  Do not edit.\n"
        << "#include \"ryacl_error.h\"\n\n"
        << "extern \"C\" {\n"
        << "const char zo_badid_ryseclib_msg[] = \"Bad message id for message set ryseclib_msg\";\n\n"
        << "// Slots other components of the shared catalog use are empty here.\n"
        << "const char *const zo_mesgtbl_ryseclib_msg[" << kSlots << "] = {\n";
    for (int n = 0; n < kSlots; ++n) {
        auto it = texts.find(n);
        out << "    /* " << n << " */ " << (it == texts.end() ? "\"\"" : c_literal(it->second)) << ",\n";
    }
    out << "};\n}\n";

    std::ostringstream hdr;
    hdr << "// Generated by msggen from ryseclib_msg.msg.  Do not edit.\n"
        << "// The messages of the default table by name.  Each constant carries the\n"
        << "// message's number and the kinds of its arguments, one per placeholder\n"
        << "// position its text uses ('s' a text, 'n' a number), so that recording a\n"
        << "// message with the wrong number or kind of arguments does not compile.\n"
        << "#pragma once\n\n#include <cstdint>\n\nnamespace acl::msg {\n\n"
        << "template <int32_t Num, char... Kinds>\nstruct id {\n"
        << "    static constexpr int32_t num = Num;\n"
        << "    static constexpr unsigned arity = sizeof...(Kinds);\n};\n\n";
    for (const auto &[num, entry] : names) {
        const std::string name = entry.substr(0, entry.find(' '));
        const std::string kinds = entry.substr(entry.find(' ') + 1);
        hdr << "inline constexpr id<" << num;
        for (char k : kinds) hdr << ", '" << k << "'";
        hdr << "> " << name << "{};\n";
    }
    hdr << "\n}  // namespace acl::msg\n";

    return write_if_changed(argv[2], out.str()) && write_if_changed(argv[3], hdr.str()) ? 0 : 1;
}
