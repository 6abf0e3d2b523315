// Fixture for platform state tests: a fresh VELA_ROOT and a clock the test
// sets itself (Now() starts at kStart and moves only when the test moves it).
#pragma once

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "vela/session.h"
#include "vela/vlibc.h"

class StateRootTest : public ::testing::Test {
protected:
    static constexpr long long kStart = 1700000000;
    static long long& Now()
    {
        static long long now = kStart;
        return now;
    }

    void SetUp() override
    {
        VELA::System::RootReset();
        Now() = kStart;
        VELA::Session::SetClockForTest(&FakeNow);
    }
    void TearDown() override
    {
        VELA::Session::SetClockForTest(nullptr);
        VELA::System::RootReset();
    }

    VELA::Test::TempDir root_;
    VELA::Test::ScopedEnv rootEnv_{"VELA_ROOT", root_.Path().c_str()};

private:
    static long long FakeNow() { return Now(); }
};
