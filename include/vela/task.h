// Task manager of the platform: records of background work that outlives
// the request which started it.
//
// A task is named by its owner and a short id. The owner is a user name or
// one of the two group owners "@administrators" and "@users"; the short id is
// made by TaskUtil::getUniqueID from a caller's prefix and 16 random hex
// digits. Both are checked before any path is built from them: an owner is
// one of the group owners or a valid account name that does not start with
// "@" or "."; a short id and a prefix are letters, digits, "_", "-" and ".",
// do not start with ".", and are at most 96 (id) or 32 (prefix) bytes.
//
// The record of a task is the JSON file <root>/var/lib/vela/tasks/OWNER/ID
// (directories 0700, file 0600), always replaced whole through a temporary
// file and a rename, so a reader never sees a partial record:
//
//   {"version":1, "owner":"alice", "id":"sum-0123456789abcdef",
//    "created":1700000000, "updated":1700000005, "finished":false,
//    "finished_at":0, "create_pid":4242, "create_start":123456,
//    "properties":{"info":{...}, "task_run":true, "body":{...}}}
//
// Changes are made between beginUpdate and endUpdate, under an exclusive
// lock on OWNER/.lock; beginUpdate reads the record afresh, so two processes
// that update one record one after the other never lose each other's
// properties. A record that was removed is never written again.
//
// The worker is known by its pid and the start time the kernel gives that
// process (/proc/PID/stat), so a pid reused by another process is never
// taken for the worker, and a worker that died without finishing is seen.
#pragma once

#include <json/json.h>
#include <string>
#include <sys/types.h>
#include <vector>

#include "vela/export.h"

// Exported from libwebapi-TARN5.so, whose other symbols are hidden.
#pragma GCC visibility push(default)

namespace TARN {

class VELA_EXPORT Task {
public:
    // Names the task; nothing is read yet. isValid() tells whether owner and
    // id passed the name checks: every other call fails on an invalid task.
    Task(const std::string& owner, const std::string& id);
    ~Task();
    Task(const Task&) = delete;
    Task& operator=(const Task&) = delete;

    bool isValid() const { return valid_; }
    const std::string& getOwner() const { return owner_; }
    const std::string& getId() const { return id_; }

    // Reads the record. False when it is missing, unreadable or not a record
    // of this task (the properties read before are then kept).
    bool reload();

    // Takes the lock (waiting at most `timeoutSec` seconds) and reads the
    // record afresh. False, with nothing held, when the lock cannot be taken
    // or the record does not exist.
    bool beginUpdate(int timeoutSec = 10);
    // Writes the record and releases the lock. False when no update was begun
    // or the write failed (the old record is then untouched).
    bool endUpdate();
    bool inUpdate() const { return lockFd_ >= 0; }

    // Properties of the task (as last read or set). setProperty outside an
    // update makes an update of its own (begin, set, end).
    bool hasProperty(const std::string& key) const;
    Json::Value getProperty(const std::string& key) const;
    bool getBoolProperty(const std::string& key, bool def) const;
    bool setProperty(const std::string& key, const Json::Value& value);
    bool removeProperty(const std::string& key);

    // The worker's process: its pid and the kernel's start time of that
    // process are recorded (an update of its own outside an update).
    bool setCreatePid(pid_t pid);
    pid_t getCreatePid() const;
    // True while the recorded worker still runs (not a zombie, same start
    // time). False when none was recorded or it is gone.
    bool isWorkerAlive() const;

    // Marks the task finished (an update of its own), or removes its record
    // when `remove` is true.
    bool finish(bool remove);
    bool isFinished() const;
    // "finished", "lost" (not finished, its recorded worker gone) or
    // "running", as listings show the task.
    const char* stateName() const;
    long long getCreated() const;
    long long getFinishedAt() const;
    // The whole record as last read (for listings).
    const Json::Value& getRecord() const { return record_; }

    // Removes the record. True when it is gone afterwards.
    bool remove();

    // Waits until the record has property `key`, re-reading it with growing
    // pauses (from 2 ms up to 100 ms), for at most `seconds` seconds. True
    // when the property appeared; false after the time is up, or at once when
    // the record is gone, the task finished or its recorded worker died.
    bool waitForDataReady(const std::string& key, int seconds);

private:
    std::string RecordPath() const;
    std::string owner_;
    std::string id_;
    bool valid_ = false;
    int lockFd_ = -1;
    Json::Value record_;
};

class VELA_EXPORT TaskUtil {
public:
    static const char* const kAdminOwner;  // "@administrators"
    static const char* const kUsersOwner;  // "@users"

    static bool isValidOwner(const std::string& owner);
    static bool isValidId(const std::string& id);
    static bool isValidPrefix(const std::string& prefix);

    // Makes a new short id, prefix + 16 random hex digits, and reserves it by
    // creating its record (no other task can get it afterwards). "" on
    // failure (invalid owner or prefix, no randomness, I/O error; logged).
    static std::string getUniqueID(const std::string& owner, const std::string& prefix);

    static bool checkTaskExists(const std::string& owner, const std::string& id);

    // Splits a full task id "OWNER/ID" at its first "/". False unless both
    // parts are valid names of a task.
    static bool splitFullId(const std::string& full, std::string& owner, std::string& id);
};

class VELA_EXPORT TaskMgr {
public:
    // The short ids of `owner`'s tasks, sorted; empty for an invalid owner.
    static std::vector<std::string> getAllTaskId(const std::string& owner);
    // Every owner that has a task directory, sorted (invalid names skipped).
    static std::vector<std::string> getAllOwners();
    // Removes the records of `owner`'s tasks that finished more than
    // `maxAgeSeconds` ago. The number removed.
    static int removeFinished(const std::string& owner, long long maxAgeSeconds);
};

}  // namespace TARN

#pragma GCC visibility pop
