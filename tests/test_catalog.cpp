// A real catalog built with gencat is preferred to the default texts, chosen
// by the locale through NLSPATH; a message it lacks falls back to the default.
// Its own executable: catalogs are opened once per process.
#include <gtest/gtest.h>
#include <locale.h>

#include <cstdlib>
#include <string>

#include "ryacl_error.h"
#include "ryacl_test_support.h"

TEST(MessageCatalog, CatalogTextWinsAndDefaultsFillTheGaps) {
    rytest::tmp_dir dir;
    ASSERT_EQ(system(("mkdir -p " + dir.path() + "/C.UTF-8").c_str()), 0);
    rytest::write_file(dir / "src.msg",
                       "$quote \"\n$set 1\n146 \"4471-160 Echec : option repetee : %1$s\\n\"\n");
    std::string cmd = std::string(RYACL_GENCAT) + " " + dir.path() + "/C.UTF-8/ryseclib.cat " + dir.path() + "/src.msg";
    ASSERT_EQ(system(cmd.c_str()), 0);
    ASSERT_NE(setlocale(LC_ALL, "C.UTF-8"), nullptr);
    setenv("NLSPATH", (dir.path() + "/%L/%N").c_str(), 1);

    acl::set_error(4, 146, "-c");
    EXPECT_EQ(rytest::error_text(), "4471-160 Echec : option repetee : -c\n");
    acl::set_error(4, 147);
    EXPECT_EQ(rytest::error_text(), zo_mesgtbl_ryseclib_msg[147]);
    // A catalog that does not exist anywhere: the default text serves.
    zo_set_error_1(4, nullptr, "no-such-catalog.cat", 1, 146, zo_mesgtbl_ryseclib_msg[146], "-v");
    EXPECT_EQ(rytest::error_text(),
              "4471-160 Failure: The following option was specified more\nthan once: -v\n"
              "Please verify that the command was issued correctly.\n");
    setlocale(LC_ALL, "C");
}
