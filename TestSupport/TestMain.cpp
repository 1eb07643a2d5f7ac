// The main function of the test programs: each test has a lifetime of its own.
#include <gtest/gtest.h>

#include "TestSupport/TestLifetime.h"

namespace {

class LifetimeOfEachTest : public testing::EmptyTestEventListener {
    void OnTestStart(const testing::TestInfo& /*test*/) override { platform::TestLifetime::begin(); }
    void OnTestEnd(const testing::TestInfo& /*test*/) override { platform::TestLifetime::end(); }
};

}  // namespace

int main(int argc, char** argv) {
    testing::InitGoogleTest(&argc, argv);
    testing::UnitTest::GetInstance()->listeners().Append(new LifetimeOfEachTest);
    return RUN_ALL_TESTS();
}
