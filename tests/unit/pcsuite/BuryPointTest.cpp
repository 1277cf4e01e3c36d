// Bury-point records in the shape posted to the PC suite.
#include <gtest/gtest.h>

#include "pcsuite/BuryPoint.h"

namespace kesu {
namespace {

TEST(BuryPointTest, ListShapeIsAOneElementArrayWithExtraMembersAfterParams) {
    const auto record = BuryPoint::listRecord("W688|10269", Json{{"result", 1}}, Json{{"duration", 5}, {"num", 2}});
    EXPECT_EQ(BuryPoint::listText(record),
              R"([{"type":1,"eventId":"W688|10269","params":{"result":1},"duration":5,"num":2}])");
}

}  // namespace
}  // namespace kesu
