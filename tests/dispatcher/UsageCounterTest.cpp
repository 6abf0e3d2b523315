// The usage counter: counter files under <root>/var/spool/webapi, the
// data-collection switch, concurrent processes, and which calls the
// pipeline counts.
#include <gtest/gtest.h>

#include <chrono>
#include <ctime>
#include <grp.h>
#include <pwd.h>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "dispatcher/PipeFixture.h"
#include "dispatcher/UsageCounter.h"
#include "platform/IdentityTestUtil.h"
#include "support/TestSupport.h"
#include "vela/sysfile.h"
#include "webapi/APIRequest.h"
#include "webapi/APIRunner.h"
#include "webapi/JsonUtil.h"

namespace {

using VELA::APIRequest;
using VELA::APIRunner;

// Shows the counter to the tests.
class CountingRunner : public APIRunner {
public:
    using APIRunner::IncreaseCounter;
};

class Counter : public PipeFixture {
protected:
    void SetUp() override
    {
        PipeFixture::SetUp();
        VELA::ResetUsageCounterState();
        spool_ = root_.Path() + "/var/spool/webapi";
    }
    void TearDown() override
    {
        VELA::ResetUsageCounterState();
        PipeFixture::TearDown();
    }

    void Collect(const char* value)
    {
        ASSERT_EQ(0, system(("mkdir -p '" + root_.Path() + "/etc'").c_str()));
        ASSERT_EQ(0, VLIBCFileSetKeyValue((root_.Path() + "/etc/velainfo.conf").c_str(), "enable_data_collect",
                                          value));
    }

    static void Count(CountingRunner& runner, const std::string& api, int version, const std::string& method)
    {
        APIRequest req(Call(api, version, method));
        runner.IncreaseCounter(&req);
    }

    Json::Value Counters(const std::string& stem)
    {
        Json::Value v;
        VELA::JsonReadFile(spool_ + "/" + stem + ".json", v);
        return v;
    }

    std::string spool_;
};

TEST_F(Counter, CountsPerCallKindInOneFilePerStem)
{
    Collect("yes");
    CountingRunner runner;
    const long long before = time(nullptr);
    Count(runner, "VELA.Core.Share.List", 1, "get");
    const long long after = time(nullptr);
    EXPECT_EQ(0, access((spool_ + "/.timestamp").c_str(), F_OK));

    Json::Value first = Counters("VELA.Core.Share.List")["VELA.Core.Share.List_1_get"];
    EXPECT_EQ(Json::Value(1), first["count"]);
    ASSERT_TRUE(first["ctime"].isInt64());
    EXPECT_LE(before, first["ctime"].asInt64());
    EXPECT_GE(after, first["ctime"].asInt64());

    // Later calls raise the count and keep the time of the first; names
    // sharing the first four components share the file.
    Count(runner, "VELA.Core.Share.List", 1, "get");
    Count(runner, "VELA.Core.Share.List.Extra", 2, "get");
    Count(runner, "VELA.Core", 1, "set");
    const Json::Value shared = Counters("VELA.Core.Share.List");
    EXPECT_EQ(Json::Value(2), shared["VELA.Core.Share.List_1_get"]["count"]);
    EXPECT_EQ(first["ctime"], shared["VELA.Core.Share.List_1_get"]["ctime"]);
    EXPECT_EQ(Json::Value(1), shared["VELA.Core.Share.List.Extra_2_get"]["count"]);
    EXPECT_EQ(2u, shared.size());
    EXPECT_EQ(Json::Value(1), Counters("VELA.Core")["VELA.Core_1_set"]["count"]);

    // A corrupt file gives way to a fresh object with only this call.
    ASSERT_EQ(0, system(("printf '{\"VELA.Core_1_set\": {\"count\": 7' > '" + spool_ + "/VELA.Core.json'").c_str()));
    Count(runner, "VELA.Core", 1, "set");
    EXPECT_EQ(Json::Value(1), Counters("VELA.Core")["VELA.Core_1_set"]["count"]);
    EXPECT_EQ(1u, Counters("VELA.Core").size());

    // Names that cannot name a counter file count nothing.
    Count(runner, "..", 1, "get");
    Count(runner, "../../etc/x", 1, "get");
    EXPECT_NE(0, access((spool_ + "/...json").c_str(), F_OK));
    for (const std::string& name : VELA::Test::DirEntries(spool_)) {
        EXPECT_TRUE(name == ".timestamp" || name.rfind("VELA.Core", 0) == 0) << name;
    }
}

TEST_F(Counter, SwitchOffCreatesNothing)
{
    for (const char* value : {"no", "YES", ""}) {
        VELA::ResetUsageCounterState();
        Collect(value);
        CountingRunner runner;
        Count(runner, "VELA.Core.Share", 1, "get");
    }
    VELA::ResetUsageCounterState();
    ASSERT_EQ(0, unlink((root_.Path() + "/etc/velainfo.conf").c_str()));
    CountingRunner runner;
    Count(runner, "VELA.Core.Share", 1, "get");
    EXPECT_NE(0, access((root_.Path() + "/var/spool").c_str(), F_OK));
}

TEST_F(Counter, ConcurrentProcessesLoseNoCount)
{
    Collect("yes");
    CountingRunner runner;
    const int kProcesses = 8;
    const int kCounts = 50;
    const auto start = std::chrono::steady_clock::now();
    pid_t children[kProcesses];
    for (pid_t& child : children) {
        child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            for (int i = 0; i < kCounts; ++i) {
                Count(runner, "VELA.Core.Share.List", 1, "get");
            }
            _exit(0);
        }
    }
    for (pid_t child : children) {
        int status = 0;
        EXPECT_EQ(child, waitpid(child, &status, 0));
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    }
    const double ms =
        std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    printf("counter: %d counts in %d processes took %.1f ms (%.3f ms per count)\n", kProcesses * kCounts,
           kProcesses, ms, ms / (kProcesses * kCounts));
    EXPECT_EQ(Json::Value(kProcesses * kCounts),
              Counters("VELA.Core.Share.List")["VELA.Core.Share.List_1_get"]["count"]);
}

// A server that runs as an ordinary user: the directory it creates lets it
// write its counts; where it cannot write, every count lost is logged.
TEST_F(Counter, OrdinaryUserCountsOrLogsTheLoss)
{
    Collect("yes");
    // As root the counting runs as "nobody"; otherwise as the test's user.
    const struct passwd* pw = geteuid() == 0 ? getpwnam("nobody") : nullptr;
    const uid_t uid = pw != nullptr ? pw->pw_uid : geteuid();
    const gid_t gid = pw != nullptr ? pw->pw_gid : getegid();
    ASSERT_NE(0u, uid) << "no unprivileged account";
    const std::string spool = root_.Path() + "/var/spool";
    ASSERT_EQ(0, chmod(root_.Path().c_str(), 0755));
    ASSERT_EQ(0, chmod((root_.Path() + "/etc/velainfo.conf").c_str(), 0644));
    ASSERT_EQ(0, system(("mkdir -p '" + spool + "'").c_str()));
    ASSERT_EQ(0, chown(spool.c_str(), uid, gid));

    // Counts `calls` calls as the user; the lines logged about lost counts.
    const auto countAsUser = [&](int calls) {
        return VELA::Test::InChild([&]() -> std::string {
            if (geteuid() == 0 &&
                (setgroups(0, nullptr) != 0 || setresgid(gid, gid, gid) != 0 || setresuid(uid, uid, uid) != 0)) {
                return "cannot become the user";
            }
            VELA::ResetUsageCounterState();
            VELA::Test::LogCapture log;
            CountingRunner runner;
            for (int i = 0; i < calls; ++i) {
                Count(runner, "VELA.Core.Share", 1, "get");
            }
            std::string lost;
            for (const std::string& line : log.Lines()) {
                if (line.find("usage count") != std::string::npos) {
                    lost += line + "\n";
                }
            }
            return lost;
        });
    };

    EXPECT_EQ("", countAsUser(2));
    struct stat st;
    ASSERT_EQ(0, stat(spool_.c_str(), &st));
    EXPECT_EQ(uid, st.st_uid);
    EXPECT_EQ(static_cast<mode_t>(S_IRWXU), st.st_mode & 07777);
    EXPECT_EQ(Json::Value(2), Counters("VELA.Core.Share")["VELA.Core.Share_1_get"]["count"]);

    ASSERT_EQ(0, chmod(spool_.c_str(), 0500));
    const std::string lost = countAsUser(2);
    size_t lines = 0;
    for (size_t at = 0; (at = lost.find("VELA.Core.Share_1_get lost", at)) != std::string::npos; ++at) {
        ++lines;
    }
    EXPECT_EQ(2u, lines) << lost;
    EXPECT_EQ(Json::Value(2), Counters("VELA.Core.Share")["VELA.Core.Share_1_get"]["count"]);
}

// The pipeline counts only what the front end marked for counting, never a
// method with "allowTimeout" nor an API with "count": false.
TEST_F(Counter, PipelineCountsMarkedCalls)
{
    Collect("yes");
    const auto run = [](Json::Value request, bool marked) {
        if (marked) {
            request["attr"]["_collector_count_webapi"] = true;
        }
        APIRunner runner;
        EXPECT_TRUE(runner.Run(request)) << request;
    };
    run(Call("VELA.Pipe.Test", 1, "echo"), true);
    run(Call("VELA.Pipe.Test", 1, "echo"), true);
    run(Call("VELA.Pipe.Test", 1, "silent"), false);
    run(Call("VELA.Pipe.Test", 1, "timeout"), true);
    run(Call("VELA.Pipe.Uncounted", 1, "get"), true);
    const Json::Value counters = Counters("VELA.Pipe.Test");
    EXPECT_EQ(1u, counters.size()) << counters;
    EXPECT_EQ(Json::Value(2), counters["VELA.Pipe.Test_1_echo"]["count"]);
    EXPECT_NE(0, access((spool_ + "/VELA.Pipe.Uncounted.json").c_str(), F_OK));
}

}  // namespace
