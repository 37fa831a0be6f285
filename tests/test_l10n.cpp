// Localisation end to end: a translated catalog built with gencat is chosen
// by the locale, through NLSPATH or installed beside the program, by the
// checker and by ryaclq (through the shared library); texts it lacks, and
// every text in the C locale, stay the built-in ones.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

const char kLocale[] = "C.UTF-8";
const char kMissingF[] = "4471-162 Echec : l'option -f manque.\n";

// A catalog of two translated messages (148, 122) at `target`, built the way
// an administrator builds one.
void build_catalog(const rytest::tmp_dir &dir, const std::string &target) {
    rytest::write_file(dir / "fr.msg", "$quote \"\n$set 1\n148 \"4471-162 Echec : l'option -f manque.\\n\"\n"
                                       "122 \"4471-135 Echec : fichier introuvable : %1$s (errno %2$d).\\n\"\n");
    ASSERT_EQ(std::system(("mkdir -p '" + target.substr(0, target.rfind('/')) + "'").c_str()), 0);
    auto r = rytest::run({RYACL_GENCAT, target, dir / "fr.msg"});
    ASSERT_EQ(r.status, 0) << r.err;
}

// "NLSPATH" without '=' removes the variable (glibc putenv).
std::vector<std::string> env_for(const std::string &locale, const std::string &nlspath) {
    return {"LANG=" + locale, "LC_ALL=" + locale, nlspath.empty() ? "NLSPATH" : "NLSPATH=" + nlspath};
}

std::string text(int num) { return zo_mesgtbl_ryseclib_msg[num]; }

TEST(Localisation, CheckerAndQueryPrintTheTranslationChosenThroughNlspath) {
    rytest::tmp_dir dir;
    build_catalog(dir, dir / (std::string(kLocale) + "/ryseclib.cat"));
    const std::string nlspath = dir.path() + "/%L/%N", missing = dir / "missing.acl";

    auto r = rytest::run_ryaclfck({"-v"}, "", env_for(kLocale, nlspath));
    EXPECT_EQ(r.status, 4);
    // The translation, then the usage text, which the catalog lacks.
    EXPECT_EQ(r.err, std::string(kMissingF) + "\n" + text(80) + "\n");
    r = rytest::run_ryaclfck({"-v"}, "", env_for("C", nlspath));  // another locale: built in
    EXPECT_EQ(r.err, text(148) + "\n" + text(80) + "\n");

    r = rytest::run({RYACLQ_PATH, "-n", missing}, "", env_for(kLocale, nlspath));
    EXPECT_EQ(r.status, 37);
    EXPECT_EQ(r.err.rfind("4471-135 Echec : fichier introuvable : " + missing + " (errno 2).\n", 0), 0u) << r.err;
    r = rytest::run({RYACLQ_PATH, "-n", missing}, "", env_for("C", ""));
    EXPECT_EQ(r.err.rfind("4471-135 Failure:", 0), 0u) << r.err;
}

// The installed layout: <prefix>/bin/ryaclfck finds
// <prefix>/share/ryacl/nls/<locale>/ryseclib.cat without NLSPATH.
TEST(Localisation, InstalledCatalogIsFoundBesideTheProgram) {
    rytest::tmp_dir prefix;
    ASSERT_EQ(mkdir((prefix / "bin").c_str(), 0755), 0);
    const std::string checker = prefix / "bin/ryaclfck";
    // The checker links the library statically, so a copy runs anywhere.
    rytest::write_file(checker, rytest::read_file(RYACLFCK_PATH), 0755);
    build_catalog(prefix, prefix / (std::string("share/ryacl/nls/") + kLocale + "/ryseclib.cat"));

    auto r = rytest::run({checker, "-v"}, "", env_for(kLocale, ""));
    EXPECT_EQ(r.status, 4);
    EXPECT_EQ(r.err.rfind(kMissingF, 0), 0u) << r.err;
    r = rytest::run({checker, "-v"}, "", env_for("C", ""));
    EXPECT_EQ(r.err.rfind(text(148), 0), 0u) << r.err;
}

}  // namespace
