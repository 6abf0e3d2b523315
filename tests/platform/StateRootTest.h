// Fixtures for platform tests: a fresh VELA_ROOT, and for state tests a
// clock the test sets itself (Now() starts at kStart and moves only when the
// test moves it).
#pragma once

#include <gtest/gtest.h>

#include <fstream>
#include <string>
#include <sys/stat.h>

#include "support/TestSupport.h"
#include "vela/session.h"
#include "vela/vlibc.h"

class RootTest : public ::testing::Test {
protected:
    RootTest() { VELA::System::RootReset(); }
    ~RootTest() override { VELA::System::RootReset(); }

    std::string In(const std::string& relative) const { return root_.Path() + relative; }
    // Writes <root>/etc/vela/<name>, making the directories on the way.
    void Conf(const std::string& name, const std::string& text)
    {
        mkdir(In("/etc").c_str(), 0755);
        mkdir(In("/etc/vela").c_str(), 0755);
        std::ofstream(In("/etc/vela/" + name), std::ios::trunc) << text;
    }

    VELA::Test::TempDir root_;
    VELA::Test::ScopedEnv rootEnv_{"VELA_ROOT", root_.Path().c_str()};
};

class StateRootTest : public RootTest {
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

private:
    static long long FakeNow() { return Now(); }
};
