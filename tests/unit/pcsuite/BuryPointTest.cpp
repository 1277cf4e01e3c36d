// Bury-point records in both shapes; the flat shape is caught as a real datagram.
#include <gtest/gtest.h>

#include "core/Utils.h"
#include "pcsuite/BuryPoint.h"
#include "support/TestSupport.h"
#include "support/UdpCatcher.h"

namespace kesu {
namespace {

using namespace std::chrono_literals;

TEST(BuryPointTest, ListShapeIsAOneElementArrayWithExtraMembersAfterParams) {
    const auto record = BuryPoint::listRecord("W688|10269", Json{{"result", 1}}, Json{{"duration", 5}, {"num", 2}});
    EXPECT_EQ(BuryPoint::listText(record),
              R"([{"type":1,"eventId":"W688|10269","params":{"result":1},"duration":5,"num":2}])");
}

TEST(BuryPointTest, FlatShapeGoesAsOneDatagramToTheCollector) {
    test::HermeticEnv env;
    test::UdpCatcher collector;
    env.config().buryPointUdpPort = collector.port();

    const long long before = static_cast<long long>(Utils::currentTimeStamp() * 1000);
    const auto record = BuryPoint::flatRecord("W688|10316", Json{{"fail_code", 500}, {"fail_reason", "x"}});
    const long long after = static_cast<long long>(Utils::currentTimeStamp() * 1000);
    ASSERT_TRUE(BuryPoint::sendFlat(record));

    const auto datagram = collector.receive(5s);
    ASSERT_TRUE(datagram.has_value());
    EXPECT_EQ(*datagram, record.dump());  // the compact JSON, nothing around it
    const Json got = Json::parse(*datagram);
    EXPECT_EQ(got["eventID"], "W688|10316");
    EXPECT_EQ(got["value"], Json::parse(R"({"fail_code":500,"fail_reason":"x"})"));
    ASSERT_TRUE(got["createTime"].is_number_integer());
    EXPECT_GE(got["createTime"].get<long long>(), before);
    EXPECT_LE(got["createTime"].get<long long>(), after);
    EXPECT_EQ(datagram->find("\"pType\""), 1u);  // members in the order they are listed
    Utils::closeLog();
}

}  // namespace
}  // namespace kesu
