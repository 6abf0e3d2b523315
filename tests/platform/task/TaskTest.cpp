// Task records: names, ids, updates from many processes, removal, the
// worker's liveness and the listing and clean-up of tasks.
#include <csignal>
#include <ctime>
#include <sys/wait.h>

#include "platform/PlatformTest.h"
#include "vela/task.h"

using TARN::Task;
using TARN::TaskMgr;
using TARN::TaskUtil;
using VELA::Test::Children;
using VELA::Test::Mode;
using VELA::Test::Names;

class TaskRecords : public RootTest {
protected:
    std::string Dir(const std::string& owner) const { return In("/var/lib/vela/tasks/" + owner); }
    bool Exists(const std::string& owner, const std::string& id) const { return Mode(Dir(owner) + "/" + id) != 0; }

    // Writes a record by hand: the usual fields, those of `fields`, then
    // `owner` and `id`.
    void Put(const std::string& owner, const std::string& id, const Json::Value& fields)
    {
        for (const std::string& dir : {In("/var"), In("/var/lib"), In("/var/lib/vela"), Dir(""), Dir(owner)}) {
            mkdir(dir.c_str(), 0700);
        }
        Json::Value record(Json::objectValue);
        record["version"] = 1;
        record["created"] = static_cast<Json::Int64>(time(nullptr));
        record["finished"] = false;
        record["properties"] = Json::Value(Json::objectValue);
        for (const std::string& key : fields.getMemberNames()) {
            record[key] = fields[key];
        }
        record["owner"] = owner;
        record["id"] = id;
        VELA::Test::WriteFile(Dir(owner) + "/" + id, Json::writeString(Json::StreamWriterBuilder(), record), 0600);
    }
};

TEST_F(TaskRecords, NamesAreCheckedBeforeAnyPathIsMade)
{
    struct Case {
        std::string name;
        bool owner, id, prefix;
    };
    const Case cases[] = {
        {"alice", true, true, true},
        {"cksum-0123", true, true, true},
        {"@users", true, false, false},
        {"@administrators", true, false, false},
        {"", false, false, true},
        {"..", false, false, false},
        {".x", false, false, false},
        {"a/b", false, false, false},
        {"@other", false, false, false},
        {"a:b", false, false, false},
        {std::string("a\nb"), false, false, false},
        {std::string("a\x7f"), false, false, false},
        {std::string("a\0b", 3), false, false, false},
        {std::string(32, 'p'), true, true, true},
        {std::string(33, 'p'), true, true, false},
        {std::string(97, 'i'), true, false, false},
        {std::string(300, 'o'), false, false, false},
    };
    ASSERT_NE("", TaskUtil::getUniqueID("bob", "p-"));
    for (const Case& c : cases) {
        SCOPED_TRACE(testing::PrintToString(c.name));
        EXPECT_EQ(c.owner, TaskUtil::isValidOwner(c.name));
        EXPECT_EQ(c.id, TaskUtil::isValidId(c.name));
        EXPECT_EQ(c.prefix, TaskUtil::isValidPrefix(c.name));
        EXPECT_EQ(c.owner && c.id, Task(c.name, c.name).isValid());
        if (!c.owner) {
            EXPECT_EQ("", TaskUtil::getUniqueID(c.name, "p-"));
        }
        if (!c.prefix) {
            EXPECT_EQ("", TaskUtil::getUniqueID("bob", c.name));
        }
    }
    // Only valid names ever became directories or records.
    EXPECT_EQ(std::set<std::string>({"bob"}), Names(In("/var/lib/vela/tasks")));
}

TEST_F(TaskRecords, UniqueIdsAreDistinctAndPrivate)
{
    const std::string a = TaskUtil::getUniqueID("alice", "sum-");
    const std::string b = TaskUtil::getUniqueID("alice", "sum-");
    ASSERT_EQ(20u, a.size());
    EXPECT_EQ(0u, a.rfind("sum-", 0));
    EXPECT_NE(a, b);
    EXPECT_EQ(0700u, Mode(Dir("alice")));
    EXPECT_EQ(0600u, Mode(Dir("alice") + "/" + a));
    EXPECT_TRUE(Task("alice", a).reload());
    EXPECT_EQ(std::vector<std::string>({std::min(a, b), std::max(a, b)}), TaskMgr::getAllTaskId("alice"));
}

TEST_F(TaskRecords, ConcurrentUpdatesLoseNothingAndReadersSeeWholeRecords)
{
    const std::string id = TaskUtil::getUniqueID("alice", "c-");
    constexpr int kWriters = 8;
    constexpr int kRounds = 50;
    Children writers(kWriters, [&](int i) {
        const std::string key = "k" + std::to_string(i);
        for (int n = 0; n < kRounds; ++n) {
            Task task("alice", id);
            if (!(task.beginUpdate(60) && task.setProperty(key, task.getProperty(key).asInt() + 1) &&
                  task.endUpdate())) {
                return 1;
            }
        }
        return 0;
    });
    // A reader meanwhile: every read is a whole record, and no counter goes back.
    const std::vector<int> reader = VELA::Test::InChildren(1, [&](int) {
        std::vector<int> seen(kWriters, 0);
        for (int n = 0; n < 300; ++n) {
            Task task("alice", id);
            if (!task.reload()) {
                return 1;
            }
            for (int i = 0; i < kWriters; ++i) {
                const int now = task.getProperty("k" + std::to_string(i)).asInt();
                if (now < seen[i]) {
                    return 2;
                }
                seen[i] = now;
            }
        }
        return 0;
    });
    EXPECT_EQ(std::vector<int>(kWriters, 0), writers.Wait());
    EXPECT_EQ(std::vector<int>({0}), reader);
    Task task("alice", id);
    ASSERT_TRUE(task.reload());
    for (int i = 0; i < kWriters; ++i) {
        EXPECT_EQ(kRounds, task.getProperty("k" + std::to_string(i)).asInt()) << i;
    }
}

TEST_F(TaskRecords, RemovedRecordIsNeverWrittenAgain)
{
    const std::string id = TaskUtil::getUniqueID("alice", "r-");
    Task stale("alice", id);
    ASSERT_TRUE(stale.reload());
    ASSERT_TRUE(Task("alice", id).remove());
    EXPECT_FALSE(stale.setProperty("late", true));
    EXPECT_FALSE(stale.beginUpdate());
    EXPECT_FALSE(Exists("alice", id));

    // Removed while other processes keep updating it: each of them stops at
    // its first failed update, and the record stays gone. The removal can
    // fall anywhere in their updates, so a few rounds.
    for (int round = 0; round < 5; ++round) {
        const std::string busy = TaskUtil::getUniqueID("alice", "r-");
        Children updaters(4, [&](int) {
            Task task("alice", busy);
            for (int n = 0; n < 20000; ++n) {
                if (!task.setProperty("n", n)) {
                    return 0;
                }
                usleep(100);  // leaves the lock free now and then for the removal
            }
            return 1;
        });
        Task task("alice", busy);
        ASSERT_TRUE(task.waitForDataReady("n", 60));
        EXPECT_TRUE(task.remove());
        EXPECT_EQ(std::vector<int>(4, 0), updaters.Wait());
        EXPECT_EQ(std::set<std::string>({".lock"}), Names(Dir("alice")));
    }
}

TEST_F(TaskRecords, WorkerIsKnownByPidAndStartTimeAndEndsTheWait)
{
    const std::string id = TaskUtil::getUniqueID("alice", "w-");
    Task task("alice", id);
    ASSERT_TRUE(task.reload());
    EXPECT_FALSE(task.isWorkerAlive());  // none recorded yet

    // The worker waits for the word, writes its result and ends.
    int go[2];
    ASSERT_EQ(0, pipe(go));
    Children worker(1, [&](int) {
        char c;
        return read(go[0], &c, 1) == 1 && Task("alice", id).setProperty("result", 42) ? 0 : 1;
    });
    close(go[0]);
    const pid_t pid = worker.Pid(0);
    ASSERT_TRUE(task.setCreatePid(pid));
    EXPECT_TRUE(task.isWorkerAlive());

    // The same pid under another start time is another process.
    Json::Value reused = task.getRecord();
    reused["create_start"] = reused["create_start"].asInt64() + 1;
    Put("alice", "w-reused", reused);
    Task other("alice", "w-reused");
    ASSERT_TRUE(other.reload());
    EXPECT_FALSE(other.isWorkerAlive());

    ASSERT_EQ(1, write(go[1], "x", 1));
    close(go[1]);
    EXPECT_TRUE(task.waitForDataReady("result", 60));
    EXPECT_EQ(42, task.getProperty("result").asInt());

    siginfo_t info;
    ASSERT_EQ(0, waitid(P_PID, pid, &info, WEXITED | WNOWAIT));  // a zombie now
    EXPECT_FALSE(task.isWorkerAlive());
    // Nobody will write this any more: the wait gives up at once, not in 120 s.
    const time_t before = time(nullptr);
    EXPECT_FALSE(task.waitForDataReady("never", 120));
    EXPECT_LT(time(nullptr) - before, 60);
    EXPECT_EQ(std::vector<int>({0}), worker.Wait());
    EXPECT_FALSE(task.isWorkerAlive());
}

TEST_F(TaskRecords, ListingAndCleanUpTakeOnlyWhatIsTheirs)
{
    const Json::Int64 now = time(nullptr);
    const auto finished = [](Json::Int64 at) {
        Json::Value fields;
        fields["finished"] = true;
        fields["finished_at"] = at;
        return fields;
    };
    Json::Value oldRunning;
    oldRunning["created"] = now - 5000;
    Put("alice", "t-old", finished(now - 1000));
    Put("alice", "t-new", finished(now - 10));
    Put("alice", "t-run", oldRunning);
    Put("bob", "t-old", finished(now - 1000));
    for (const char* junk : {".lock", ".t-x.new", ".t-old.Ab12Cd", "a b"}) {
        VELA::Test::WriteFile(Dir("alice") + "/" + junk, "{}", 0600);
    }
    mkdir(Dir(".hidden").c_str(), 0700);
    mkdir(Dir("@other").c_str(), 0700);

    EXPECT_EQ(std::vector<std::string>({"alice", "bob"}), TaskMgr::getAllOwners());
    EXPECT_EQ(std::vector<std::string>({"t-new", "t-old", "t-run"}), TaskMgr::getAllTaskId("alice"));
    EXPECT_EQ(1, TaskMgr::removeFinished("alice", 100));
    EXPECT_EQ(std::vector<std::string>({"t-new", "t-run"}), TaskMgr::getAllTaskId("alice"));
    EXPECT_TRUE(Exists("bob", "t-old"));
}

TEST_F(TaskRecords, FieldsOfTheWrongTypeNeverThrow)
{
    Json::Value odd;
    odd["created"] = Json::UInt64(18446744073709551615ull);
    odd["finished"] = "yes";
    odd["finished_at"] = 1e300;
    odd["create_pid"] = 1e19;
    odd["create_start"] = "x";
    Put("alice", "t-odd", odd);
    Task task("alice", "t-odd");
    ASSERT_TRUE(task.reload());
    EXPECT_NO_THROW({
        EXPECT_EQ(0, task.getCreated());
        EXPECT_EQ(0, task.getFinishedAt());
        EXPECT_FALSE(task.isFinished());
        EXPECT_FALSE(task.isWorkerAlive());
        EXPECT_TRUE(task.finish(false));
    });
    ASSERT_TRUE(task.reload());
    EXPECT_TRUE(task.isFinished());
}
