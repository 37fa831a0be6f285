// The ACL text parser: outcomes line by line, limits, messages, and the
// cursor protocol.  (Random texts: the fuzz target fuzz_acl_text.)
#include <gtest/gtest.h>
#include <locale.h>

#include <cctype>

#include "lib_acl_bytes.h"
#include "ryacl_acl_entry.h"

using namespace std::string_literals;

namespace {

// The current error as "E<message>" and its arguments ("@<int>", "(<text>)"),
// checking the return code that goes with the message.
std::string error_word(int32_t rc) {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    if (!rec) return "E-none";
    std::string w = "E" + std::to_string(rec->zo_msg_num);
    for (uint32_t k = 0; k < rec->zo_arg_cnt; ++k) {
        const zo_error_arg_value_t &v = rec->zo_args[k].zo_arg_value;
        w += rec->zo_args[k].zo_arg_type == ZO_ERROR_ARG_CHAR_STR ? "("s + v.zo_arg_char_str + ")"
                                                                   : "@" + std::to_string(v.zo_arg_int);
    }
    EXPECT_EQ(rc, rec->zo_msg_num == 145 ? 37 : rec->zo_msg_num == 166 ? 36 : 42) << w;
    zo_rel_error_1(rec);
    return w;
}

// A whole text parsed into one word per line (".", "u:unix:alice:3", "E158@2"),
// checking the cursor protocol after every call.
std::string words_of(const std::string &text) {
    // Exactly the text and its NUL, so that a sanitizer sees any read past it.
    std::vector<char> buf;
    buf.reserve(text.size() + 1);
    buf.assign(text.begin(), text.end());
    buf.push_back('\0');
    char *cur = buf.data(), *const end = buf.data() + buf.size();
    size_t len = buf.size();
    int32_t line = 1, rc, n = 0;
    std::string words;
    sec_acle_desc e;
    // A parser that never reaches the end stops at one word per byte.
    for (char *before = cur; (rc = sec__read_acle_from_text(nullptr, &cur, &len, &line, &e)) != 0 &&
                             n <= static_cast<int32_t>(buf.size());
         before = cur) {
        EXPECT_EQ(line, ++n + 1);
        EXPECT_TRUE(cur ? cur > before && len == static_cast<size_t>(end - cur) : len == 0);
        std::string w = rc != 1 ? error_word(rc) : e.type ? std::string(1, acl__type_letter(e.type)) : ".";
        if (rc == 1 && e.type)
            w += (e.mech[0] ? ":"s + e.mech : "") + (e.id ? ":"s + (e.id >= buf.data() && e.id < end ? e.id : "OUT") : "") +
                 ":" + std::to_string(e.perm);
        words += (n > 1 ? " " : "") + w;
    }
    EXPECT_TRUE(rc == 0 && e.type == 0 && line == n + 1);
    return words;
}

TEST(AclParse, LineOutcomesLimitsAndMessages) {
    const std::string x1094(1094, 'x'), a1093(1093, 'a');
    const struct { std::string text, expect; } cases[] = {
        {"", ""},
        {"\n# c\n \t\v\n", ". . ."},
        {"N\no # comment\ng staff\nu unix alice\n", "n:0 o:0 g:staff:0 u:unix:alice:0"},
        {"G\nu unix\ne hba2 # alice\ng\t\n", "E158@1 E158@2 E158@3 E158@4"},
        // 166 replaces the template lookup's 133.
        {"n rw x\nn rw #x\nn rw#x\nn unix rw\n", "E159@1 n:3 E166@3(rw#x) E166@4(unix)"},
        {"g staff rw x\nu unix alice r w\ne k id #\nnn rw\nx\n", "E159@1 E159@2 e:k:id:0 E165@4(nn) E165@5(x)"},
        {"U UNIX Alice r\ne abcdefghijklmnop id\ne abcdefghijklmnopq id\n",
         "u:unix:Alice:1 e:abcdefghijklmnop:id:0 E132(abcdefghijklmnopq)@3"},
        {"n r\r\ng staff\r\nx\r\n", "n:1 . g:staff:0 . E165@5(x) ."},
        {"u unix\falice r\ng staff\rrw\n", "E158@1 E165@2(alice) g:staff:0 E165@4(rw)"},
        {"u\tunix\valice\trl  \t# c", "u:unix:alice:65"},
        {"n r\n\0g x\n"s, "n:1 E131@2"},
        {"g st\0aff\nn\n"s, "E131@1"},
        {"x r\0\n"s, "E165@1(x)"},
        {"\0"s, "E131@1"},
        // 1095 characters pass and 1096 fail, a final NUL counting as the terminator.
        {"#" + x1094 + "\n#" + x1094, ". ."},
        {"g " + a1093, "g:" + a1093 + ":0"},
        {"#x" + x1094 + "\nn r", "E145@1 n:1"},
        {"g a" + a1093, "E145@1"},
        {"x " + x1094 + x1094 + "\n", "E145@1"},
    };
    for (const auto &c : cases) EXPECT_EQ(words_of(c.text), c.expect) << c.text;
}

// Every byte separates tokens exactly where the locale's isspace says so,
// in each locale the parser is used in, set for the process or the thread.
TEST(AclParse, TokenBytesFollowTheLocale) {
    auto check_all_bytes = [](const char *where) {
        for (int b = 1; b < 256; ++b) {
            if (b == '\n' || b == '\f' || b == '\r' || b == '#') continue;
            const std::string text = "g a"s + static_cast<char>(b) + "b\n";
            const std::string expect = std::isspace(b) ? "E166@1(b)" : "g:a"s + static_cast<char>(b) + "b:0";
            EXPECT_EQ(words_of(text), expect) << where << " byte " << b;
        }
    };
    const std::string saved = setlocale(LC_CTYPE, nullptr);
    for (const char *name : {"C", "C.UTF-8", "POSIX"}) {
        if (!setlocale(LC_CTYPE, name)) continue;
        check_all_bytes(name);
    }
    setlocale(LC_CTYPE, saved.c_str());
    if (locale_t loc = newlocale(LC_CTYPE_MASK, "C.UTF-8", nullptr)) {
        locale_t before = uselocale(loc);
        check_all_bytes("thread C.UTF-8");
        uselocale(before);
        freelocale(loc);
    }
}

}  // namespace
