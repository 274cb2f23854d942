// Container classes on the command line: numbers and short names of the
// class table, nothing outside 1..13.

#include "Client/quarnctl/ContainerClassName.h"

#include "Daemon/model/QRNContainerClass.h"

#include <gtest/gtest.h>

using namespace quarn;
using namespace quarn::ctl;

TEST(ContainerClassName, EveryClassByNumberAndByName) {
    for (std::uint64_t cls = 1; cls <= 13; ++cls) {
        EXPECT_EQ(ContainerClassName::parse(std::to_string(cls)), cls);
        EXPECT_EQ(ContainerClassName::parse(QRNContainerClass::shortName(cls)), cls);
    }
    EXPECT_EQ(ContainerClassName::parse("APPDATA"), 2u);
    EXPECT_EQ(ContainerClassName::parse("systemgroup"), 13u);
}

TEST(ContainerClassName, RefusesWhatIsNoClass) {
    for (const char* text : {"0", "14", "-1", "+2", " 2", "2x", "", "appdata2", "Undefined", "MAX",
                             "99999999999999999999"}) {
        EXPECT_FALSE(ContainerClassName::parse(text)) << text;
    }
}
