// Background tasks: a worker started for real (a detached process), its
// answers and progress in the record, the owner check and the error codes of
// status, stop and list, a crashed worker.
#include <gtest/gtest.h>

#include <algorithm>
#include <csignal>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/StateRootTest.h"
#include "vela/task.h"
#include "webapi/APIError.h"
#include "webapi/APIPolling.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"

using VELA::APIPolling;
using VELA::APIRequest;
using VELA::APIResponse;

namespace {

Json::Value RequestOf(const std::string& user, bool admin)
{
    Json::Value r(Json::objectValue);
    r["getParam"]["api"] = "VELA.Sample";
    r["getParam"]["version"] = 1;
    r["getParam"]["method"] = "checksum";
    r["getParam"]["n"] = 7;
    r["getParam"]["_sid"] = "secret-session";
    r["session"]["username"] = user;
    r["session"]["isAdmin"] = admin;
    return r;
}

void Reports(APIRequest* req, APIResponse* resp, void*)
{
    APIPolling(req).SetProgress(150, "half");
    Json::Value data(Json::objectValue);
    data["x"] = 1;
    resp->SetSuccess(data);
}

void Crashes(APIRequest*, APIResponse*, void*) { raise(SIGKILL); }

class APIPollingTest : public RootTest {
protected:
    APIRequest alice_{RequestOf("alice", false)};
    APIRequest bob_{RequestOf("bob", false)};
    APIRequest admin_{RequestOf("root", true)};

    std::string StartTask(APIRequest& req, void (*work)(APIRequest*, APIResponse*, void*))
    {
        APIPolling polling(&req);
        APIResponse resp(&req);
        EXPECT_TRUE(polling.Start(&resp, work, nullptr));
        return resp.GetBody()["data"]["task_id"].asString();
    }
    // Status until the task is finished (the worker is another process).
    Json::Value Finished(APIRequest& req, const std::string& id)
    {
        Json::Value out;
        for (int i = 0; i < 1000; ++i) {
            APIPolling polling(&req);
            if (polling.Status(id, out) && out["finish"].asBool()) {
                break;
            }
            usleep(10000);
        }
        return out;
    }
    // A task of `owner` made by hand, its worker a child that has exited.
    std::string Task(const std::string& owner)
    {
        const std::string id = TARN::TaskUtil::getUniqueID(owner, "t-");
        TARN::Task task(owner, id);
        const pid_t child = fork();
        if (child == 0) {
            _exit(0);
        }
        task.setCreatePid(child);
        waitpid(child, nullptr, 0);
        return owner + "/" + id;
    }
};

TEST_F(APIPollingTest, WorkerAnswersIntoItsRecord)
{
    const std::string id = StartTask(alice_, Reports);
    ASSERT_EQ(id.rfind("alice/", 0), 0u) << id;
    const Json::Value out = Finished(alice_, id);
    EXPECT_TRUE(out["finish"].asBool());
    EXPECT_EQ(out["data"]["x"], 1);
    EXPECT_EQ(out["progress"]["percent"], 100);
    EXPECT_EQ(out["progress"]["description"], "half");
    EXPECT_EQ(out["info"]["param"]["n"], 7);
    EXPECT_FALSE(out["info"]["param"].isMember("_sid"));
    EXPECT_EQ(out["info"]["method"], "checksum");

    Json::Value list;
    APIPolling polling(&alice_);
    ASSERT_TRUE(polling.List("VELA.Sample", Json::Value(), list));
    ASSERT_EQ(list["total"].asInt(), 1) << list.toStyledString();
    EXPECT_EQ(list["tasks"][0]["task_id"], id);
    ASSERT_TRUE(APIPolling(&bob_).List("VELA.Sample", Json::Value(), list));
    EXPECT_EQ(list["total"].asInt(), 0);
    ASSERT_TRUE(polling.List("VELA.Other", Json::Value(), list));
    EXPECT_EQ(list["total"].asInt(), 0);
}

TEST_F(APIPollingTest, CrashedWorkerIsFinishedWithAnError)
{
    const std::string id = StartTask(alice_, Crashes);
    const Json::Value out = Finished(alice_, id);
    EXPECT_TRUE(out["finish"].asBool());
    EXPECT_EQ(out["error"]["code"], WEBAPI_ERR_NO_RESPONSE);
}

TEST_F(APIPollingTest, OwnerCheckAndCodes)
{
    const std::string mine = Task("alice");
    const std::string everyone = Task(TARN::TaskUtil::kUsersOwner);
    const std::string admins = Task(TARN::TaskUtil::kAdminOwner);
    const struct {
        APIRequest* req;
        std::string id;
        int code;  // 0: allowed
    } rows[] = {
        {&alice_, mine, 0},          {&bob_, mine, WEBAPI_ERR_POLLING_BAD_TASK_ID},
        {&admin_, mine, WEBAPI_ERR_POLLING_BAD_TASK_ID},
        {&bob_, everyone, 0},        {&bob_, admins, WEBAPI_ERR_POLLING_BAD_TASK_ID},
        {&admin_, admins, 0},        {&alice_, "alice-no-slash", WEBAPI_ERR_POLLING_BAD_TASK_ID},
        {&alice_, "alice/../bob/x", WEBAPI_ERR_POLLING_BAD_TASK_ID},
        {&alice_, "alice/t-0000", WEBAPI_ERR_POLLING_NO_SUCH_TASK},
        {&alice_, "", WEBAPI_ERR_POLLING_BAD_PARAMETER},
        {nullptr, mine, WEBAPI_ERR_POLLING_BAD_PARAMETER},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.id);
        APIPolling polling(row.req);
        Json::Value out;
        EXPECT_EQ(polling.Status(row.id, out), row.code == 0);
        EXPECT_EQ(polling.GetError(), row.code);
        // Stopping: the workers have exited, which is no error; the task
        // is then only marked finished.
        APIPolling stopper(row.req);
        EXPECT_EQ(stopper.Stop(row.id, false), row.code == 0);
        EXPECT_EQ(stopper.GetError(), row.code);
    }
    Json::Value out;
    ASSERT_TRUE(APIPolling(&alice_).Status(mine, out));
    EXPECT_TRUE(out["finish"].asBool());

    Json::Value ids(Json::arrayValue);
    ids.append(mine);
    ids.append("bob/x");
    APIPolling several(&alice_);
    EXPECT_FALSE(several.Status(ids, out));
    EXPECT_TRUE(out[mine]["finish"].asBool());
    EXPECT_EQ(out["bob/x"]["error"], WEBAPI_ERR_POLLING_BAD_TASK_ID);
}

TEST_F(APIPollingTest, GroupAttributes)
{
    APIPolling polling(&alice_);
    EXPECT_FALSE(polling.SetGroupAttr("friends"));
    EXPECT_EQ(polling.GetError(), WEBAPI_ERR_POLLING_BAD_PARAMETER);
    EXPECT_FALSE(polling.SetGroupAttr("admin"));
    EXPECT_EQ(polling.GetError(), WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION);
    EXPECT_FALSE(polling.SetPrefixAttr("../x"));

    // Set by an administrator, started for a user: refused with 105.
    APIPolling handed(&admin_);
    ASSERT_TRUE(handed.SetGroupAttr("admin"));
    handed.SetRequest(&alice_);
    APIResponse resp(&alice_);
    EXPECT_FALSE(handed.Start(&resp, Reports, nullptr));
    EXPECT_EQ(resp.GetError(), WEBAPI_ERR_NO_PERMISSION);
    EXPECT_TRUE(TARN::TaskMgr::getAllTaskId(TARN::TaskUtil::kAdminOwner).empty());

    Json::Value list;
    EXPECT_FALSE(polling.List("VELA.Sample", Json::Value("admin"), list));
    Json::Value filter(Json::objectValue);
    filter["group"] = "admin";
    EXPECT_FALSE(polling.List("VELA.Sample", filter, list));
    EXPECT_EQ(polling.GetError(), WEBAPI_ERR_POLLING_NO_ADMIN_PERMISSION);
}

TEST_F(APIPollingTest, RunningAndKeptTasksAreBounded)
{
    Conf("webapi.conf", "task_max_running=1\ntask_max_kept=3\n");
    // Finished tasks beyond what an owner may keep go, the oldest first.
    std::vector<std::string> finished;
    for (int i = 0; i < 3; ++i) {
        finished.push_back(Task("alice"));
        TARN::Task task("alice", finished.back().substr(6));
        ASSERT_TRUE(task.finish(false));
    }
    // A task that is still starting (no worker yet) counts as running.
    const std::string starting = TARN::TaskUtil::getUniqueID("alice", "t-");
    ASSERT_TRUE(TARN::Task("alice", starting).setProperty("user", "alice"));
    APIPolling polling(&alice_);
    APIResponse resp(&alice_);
    EXPECT_FALSE(polling.Start(&resp, Reports, nullptr));
    EXPECT_EQ(resp.GetError(), WEBAPI_ERR_COMPOUND_OR_FORK);
    const std::vector<std::string> left = TARN::TaskMgr::getAllTaskId("alice");
    EXPECT_EQ(left.size(), 2u);
    EXPECT_TRUE(std::find(left.begin(), left.end(), starting) != left.end());
}

}  // namespace
