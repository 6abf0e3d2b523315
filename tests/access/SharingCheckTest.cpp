// Calls through sharing links under a fresh VELA_ROOT, with links and
// visitor sessions made through the sharing store and the test clock: the
// matching of check tables, the check libraries and their cache, the
// credential switch around a check, the visitor's session facts, every
// refusal of the front end's sharing hook, and the sample share handlers
// against paths that try to leave the shared folder.
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <fstream>
#include <memory>
#include <pwd.h>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "access/SharingCheck.h"
#include "dispatcher/PipeFixture.h"
#include "support/JsonLiteral.h"
#include "support/TestSupport.h"
#include "vela/sharing.h"
#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/APITable.h"
#include "webentry/WebEntry.h"

namespace {

using VELA::APIRequest;
using VELA::APIResponse;
using VELA::Test::LogCapture;
using VELA::Test::ScopedEnv;
using namespace VELA::sharing;

struct Entry : VELA::WebEntry {
    using VELA::WebEntry::CheckRequestParam;
};

bool Allow(APIRequest*, APIResponse*) { return true; }
bool Other(APIRequest*, APIResponse*) { return true; }

const char kClient[] = "10.0.0.1";

std::string Built(const std::string& relative)
{
    const char* dir = getenv("VELA_TEST_BINARY_DIR");
    return std::string(dir != nullptr ? dir : ".") + relative;
}

void Copy(const std::string& from, const std::string& to, mode_t mode)
{
    std::ifstream in(from, std::ios::binary);
    ASSERT_TRUE(in.good()) << from;
    std::ofstream(to, std::ios::binary | std::ios::trunc) << in.rdbuf();
    ASSERT_EQ(0, chmod(to.c_str(), mode));
}

class SharingCheckTest : public WebapiDirFixture {
protected:
    void SetUp() override
    {
        WebapiDirFixture::SetUp();
        const struct passwd* pw = getpwnam("daemon");
        ASSERT_NE(nullptr, pw);
        owner_ = pw->pw_uid;
        ownerGid_ = pw->pw_gid;
        WriteJson("VELA.Test.Share.lib", J(R"({"VELA.Test.Share": {"lib": "none.so", "minVersion": 1,
            "maxVersion": 1, "methods": {"1": [{"probe": {"allowSharing": true}}, {"deny": {"allowSharing": true}},
            {"other": {"allowSharing": true}}, "closed",
            {"skip": {"allowSharing": true, "skipSharingAppCheck": true}}]}}})"));
        libDir_ = In("/usr/lib/sharing/permission_lib/");
        ASSERT_EQ(0, system(("mkdir -p '" + libDir_ + "'").c_str()));
        // The library is loaded as its owner, who must reach it: searchable
        // like the real root.
        ASSERT_EQ(0, chmod(In("").c_str(), 0755));
        Copy(Built("/tests/dispatcher/libs/libsharing_probe.so"), libDir_ + "probe.so", 0755);
        ASSERT_EQ(0, chown((libDir_ + "probe.so").c_str(), owner_, ownerGid_));
    }

    record::Entry Link(const std::string& project, const std::string& path = "/volume1/share",
                       bool matchIP = false, long long expire = 0, long long limit = 0)
    {
        db::LinkSpec link;
        link.projectName = project;
        link.path = path;
        link.uid = owner_;
        link.userName = "daemon";
        link.enableMatchIP = matchIP;
        link.expireTime = expire;
        link.useLimit = limit;
        record::Entry e;
        EXPECT_TRUE(db::EntryDB(db::SharingDB::Instance()).Create(link, e));
        return e;
    }
    std::string Visit(const record::Entry& e, long long lifetime = 600)
    {
        record::Session s;
        record::Token t;
        EXPECT_EQ(SHARING_STATUS_VALID,
                  db::SessionDB(db::SharingDB::Instance()).Create(e.get_hash(), "", kClient, lifetime, s, t));
        return s.get_session_id();
    }

    // A new front end whose request calls VELA.Test.Share `method` through
    // link `id` with visitor session `sid` ("" leaves a part out), described.
    APIRequest* Prepare(const std::string& method, const std::string& id, const std::string& sid,
                        const Json::Value& params = Json::Value(Json::objectValue))
    {
        Json::Value env(Json::objectValue);
        env["REQUEST_METHOD"] = "GET";
        if (!id.empty()) {
            env[SZ_X_SHARING_HEADER] = id;
        }
        if (!sid.empty()) {
            env["HTTP_COOKIE"] = std::string(SZK_SHARING_SID) + "=" + sid;
        }
        own_.reset(new Entry);
        APIRequest* req = E().GetRequest();
        req->InitEnv(env);
        Json::Value call = Call("VELA.Test.Share", 1, method, params);
        req->InitParam(call, true);
        EXPECT_TRUE(E().CheckRequestParam(req, E().GetResponseObject())) << method;
        EXPECT_TRUE(E().AddAPIInfo(req));
        return req;
    }
    bool Check() { return E().CheckSharingPermission(E().GetRequest(), E().GetResponseObject()); }
    int Error() { return E().GetResponseObject()->GetError(); }

    uid_t owner_ = 0;
    gid_t ownerGid_ = 0;
    std::string libDir_;
    ScopedEnv remote_{"REMOTE_ADDR", kClient};
    std::unique_ptr<Entry> own_{new Entry};
    Entry& E() { return *own_; }
};

TEST(SharingMatch, RegexAndTableOrder)
{
    struct {
        const char* pattern;
        const char* text;
        bool match;
    } cases[] = {
        {"*", "anything", true},        {"*", "", true},
        {"^list$", "list", true},       {"^list$", "listing", false},
        {"list", "blacklist", true},    {"^VELA\\.A$", "VELA.A", true},
        {"^VELA\\.A$", "VELAxA", false}, {"(unclosed", "(unclosed", false},
        {"a|b", "b", true},             {"", "x", true},
        {nullptr, "x", false},          {"x", nullptr, false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(c.match, VELA::SharingCheck::RegexMatch(c.pattern, c.text) == 0)
            << (c.pattern ? c.pattern : "null") << " ~ " << (c.text ? c.text : "null");
    }

    _tag_API_SHARING_CHECK_TABLE table[] = {
        {"", 0, "*", Other},                // empty api pattern: skipped with a warning
        {"^VELA\\.X$", 2, "*", Other},      // another version
        {"^VELA\\.X$", 0, "", Other},       // empty method pattern: skipped with a warning
        {"^VELA\\.X$", 1, "^get$", Allow},  // the first that matches wins
        {"*", 0, "*", Other},
        {nullptr, 0, nullptr, nullptr},
    };
    APIRequest req(J(R"({"getParam": {"api": "VELA.X", "version": "1", "method": "get"}})"));
    APICheckFn fn = nullptr;
    LogCapture log;
    ASSERT_TRUE(VELA::SharingCheck::GetSharingCheckFunc(&req, table, &fn));
    EXPECT_EQ(&Allow, fn);
    EXPECT_TRUE(log.Contains("warning: empty api regex in"));
    EXPECT_TRUE(log.Contains("warning: empty method regex in"));
    APIRequest other(J(R"({"getParam": {"api": "VELA.X", "version": "1", "method": "put"}})"));
    ASSERT_TRUE(VELA::SharingCheck::GetSharingCheckFunc(&other, table, &fn));
    EXPECT_EQ(&Other, fn);
    EXPECT_FALSE(VELA::SharingCheck::GetSharingCheckFunc(&other, table + 5, &fn));
    EXPECT_FALSE(VELA::SharingCheck::GetSharingCheckFunc(&other, nullptr, &fn));
    EXPECT_TRUE(log.Contains("bad parameters"));
}

// Library paths under the root, refusals, and one dlopen per library for
// the life of the process.
TEST_F(SharingCheckTest, LibrariesAreFoundUnderTheRootAndOpenedOnce)
{
    const record::Entry probe = Link("probe");
    APIRequest* req = Prepare("probe", probe.get_hash(), "");
    EXPECT_EQ(libDir_ + "probe.so", E().GetSharingCheckLibPath(req));
    Prepare("probe", "AAAAAAAAAAAAAAAAAAAAAA", "");  // no such link: no project
    EXPECT_EQ("", E().GetSharingCheckLibPath(E().GetRequest()));

    const size_t before = VELA::SharingCheck::OpenedLibraries();
    _tag_API_SHARING_CHECK_TABLE* table = nullptr;
    for (int i = 0; i < 2; ++i) {
        Prepare("probe", probe.get_hash(), "");
        table = nullptr;
        ASSERT_TRUE(E().OpenSharingCheckLib(E().GetRequest(), &table));
        EXPECT_NE(nullptr, table);
    }
    EXPECT_EQ(before + 1, VELA::SharingCheck::OpenedLibraries());

    LogCapture log;
    Prepare("probe", Link("missing").get_hash(), "");
    EXPECT_FALSE(E().OpenSharingCheckLib(E().GetRequest(), &table));
    EXPECT_TRUE(log.Contains("cannot open library: " + libDir_ + "missing.so"));
    Copy(libDir_ + "probe.so", libDir_ + "loose.so", 0775);  // group-writable: never loaded
    Prepare("probe", Link("loose").get_hash(), "");
    EXPECT_FALSE(E().OpenSharingCheckLib(E().GetRequest(), &table));
    Copy(Built("/tests/dispatcher/libs/libreg_notable.so"), libDir_ + "notable.so", 0755);
    Prepare("probe", Link("notable").get_hash(), "");
    EXPECT_FALSE(E().OpenSharingCheckLib(E().GetRequest(), &table));
    EXPECT_TRUE(log.Contains("Get Sharing Check Table Fail"));
    EXPECT_FALSE(E().OpenSharingCheckLib(E().GetRequest(), nullptr));
    EXPECT_EQ(before + 2, VELA::SharingCheck::OpenedLibraries());
}

TEST_F(SharingCheckTest, VisitorSessionIsTheOwners)
{
    const record::Entry e = Link("probe", "/volume1/share", true);
    const std::string sid = Visit(e, 600);
    Prepare("probe", e.get_hash(), sid);
    APIRequest* req = E().GetRequest();
    E().InitSharingSession(req);
    EXPECT_EQ("daemon", req->GetLoginUserName());
    EXPECT_EQ(10, req->GetTimeoutDuration());
    EXPECT_FALSE(req->IsAuthorized());
    EXPECT_FALSE(req->IsAdmin());
    EXPECT_TRUE(req->IsSkipCheckIP());  // the link's match-ip switch as it stands
    EXPECT_STREQ("daemon", getenv("VELA_WEBAPI_USERNAME"));

    Now() = kStart + 600 + 60;  // ended a minute ago
    E().InitSharingSession(req);
    EXPECT_EQ(15, req->GetTimeoutDuration());
}

// Each refusal of the hook, then the calls it lets through.
TEST_F(SharingCheckTest, HookRefusesWithTheStatusCodeAndRunsTheCheckAsTheLibraryOwner)
{
    const record::Entry e = Link("probe");
    const std::string sid = Visit(e);

    Prepare("probe", "", sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(126, Error());
    Prepare("closed", e.get_hash(), sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(126, Error());
    EXPECT_EQ(AUTH_RESULT_REJECTED, E().GetRequest()->GetAuthResult());

    Prepare("probe", "AAAAAAAAAAAAAAAAAAAAAA", sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(122, Error());
    Prepare("probe", e.get_hash(), "");
    EXPECT_FALSE(Check());
    EXPECT_EQ(124, Error());
    Prepare("probe", e.get_hash(), Visit(Link("probe")));  // another link's session
    EXPECT_FALSE(Check());
    EXPECT_EQ(124, Error());
    {
        const record::Entry matched = Link("probe", "/volume1/share", true);
        const std::string msid = Visit(matched);
        ScopedEnv elsewhere("REMOTE_ADDR", "10.0.0.2");
        Prepare("probe", matched.get_hash(), msid);
        EXPECT_FALSE(Check());
        EXPECT_EQ(127, Error());
    }
    const record::Entry once = Link("probe", "/volume1/share", false, 0, 1);
    Visit(once);
    Prepare("probe", once.get_hash(), "");
    EXPECT_FALSE(Check());
    EXPECT_EQ(123, Error());
    const record::Entry expiring = Link("probe", "/volume1/share", false, kStart + 100000);
    const std::string esid = Visit(expiring);
    const record::Entry revoked = Link("probe");
    const std::string rsid = Visit(revoked);
    ASSERT_TRUE(db::EntryDB(db::SharingDB::Instance()).Revoke(revoked.get_hash()));
    Prepare("probe", revoked.get_hash(), rsid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(123, Error());

    // Allowed: the check ran as the library file's owner, and the process is
    // root again afterwards.
    Prepare("probe", e.get_hash(), sid, J(R"({"x": "1"})"));
    ASSERT_TRUE(Check()) << Error();
    EXPECT_EQ(static_cast<int>(owner_), E().GetRequest()->GetAttr("checkEuid").asInt());
    // Its constructors ran as the owner too, never as root.
    EXPECT_EQ(static_cast<int>(owner_), E().GetRequest()->GetAttr("loadEuid").asInt());
    EXPECT_EQ(static_cast<int>(ownerGid_), E().GetRequest()->GetAttr("checkEgid").asInt());
    EXPECT_EQ(0u, geteuid());
    EXPECT_EQ(0u, getegid());
    EXPECT_EQ("daemon", E().GetRequest()->GetLoginUserName());
    Prepare("deny", e.get_hash(), sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(1234, Error());  // the library's own code
    Prepare("other", e.get_hash(), sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(126, Error());  // no entry of the table matches
    const record::Entry nolib = Link("nolib");
    const std::string nsid = Visit(nolib);
    Prepare("skip", nolib.get_hash(), nsid);
    EXPECT_TRUE(Check());
    Prepare("probe", nolib.get_hash(), nsid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(126, Error());

    Now() = kStart + 601;
    Prepare("probe", e.get_hash(), sid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(125, Error());
    Now() = kStart + 100001;
    Prepare("probe", expiring.get_hash(), esid);
    EXPECT_FALSE(Check());
    EXPECT_EQ(123, Error());
}

// The checker front end: Initialize from the CGI environment, then only the
// application's check.
TEST_F(SharingCheckTest, SharingCheckerRunsOnlyTheApplicationsCheck)
{
    const record::Entry e = Link("probe");
    for (const char* method : {"probe", "deny"}) {
        const std::string query = std::string("api=VELA.Test.Share&version=1&method=") + method +
                                  "&_sharing_id=" + e.get_hash() + "&_sharing_sid=" + Visit(e);
        ScopedEnv get("REQUEST_METHOD", "GET");
        ScopedEnv q("QUERY_STRING", query.c_str());
        VELA::SharingChecker checker;
        EXPECT_EQ(std::string(method) == "probe", checker.Run(Json::Value())) << method;
        EXPECT_EQ(e.get_hash(), checker.GetRequest()->GetSharingID());
    }
}

// The sample share handlers, called as the road would after the check: a
// shared folder with a file, a sub-folder, and links that lead out of it.
TEST_F(SharingCheckTest, SampleShareStaysInsideTheSharedFolder)
{
    void* lib = dlopen(Built("/root/usr/vela/velaman/webapi/share/libvela-share.so").c_str(), RTLD_NOW);
    ASSERT_NE(nullptr, lib) << dlerror();
    auto table = reinterpret_cast<GetAPITableFn>(dlsym(lib, "GetAPITable"))();
    ASSERT_STREQ("list", table[0].method);
    ASSERT_STREQ("download", table[1].method);
    const std::string share = In("/share");
    ASSERT_EQ(0, system(("mkdir -p '" + share + "/sub' && echo secret > '" + In("/secret") + "' && echo hi > '" +
                         share + "/sub/a.txt' && ln -s ../secret '" + share + "/out' && ln -s sub '" + share +
                         "/inner'").c_str()));
    const record::Entry e = Link("sample-share", "/share");  // as the system sees it
    const std::string sid = Visit(e);

    auto run = [&](int which, const Json::Value& params) {
        Prepare("probe", e.get_hash(), sid, params);
        APIResponse* resp = E().GetResponseObject();
        resp->SetError(0);
        table[which].handler(E().GetRequest(), resp);
        return resp;
    };
    APIResponse* resp = run(0, Json::Value(Json::objectValue));
    ASSERT_EQ(0, resp->GetError());
    EXPECT_EQ(3u, resp->GetBody()["data"]["files"].size());
    resp = run(0, J(R"({"path": "sub"})"));
    ASSERT_EQ(0, resp->GetError());
    EXPECT_EQ("a.txt", resp->GetBody()["data"]["files"][0]["name"].asString());

    const char* const refused[] = {"..", "../secret", "/etc/passwd", "sub/../../secret", "./sub", "sub//a.txt",
                                   "out", "inner/a.txt", "sub/a\n.txt", "sub/nothing"};
    for (const char* path : refused) {
        Json::Value params(Json::objectValue);
        params["path"] = path;
        EXPECT_NE(0, run(1, params)->GetError()) << path;
        EXPECT_NE(0, run(0, params)->GetError()) << path;
    }
    Json::Value nul(Json::objectValue);
    nul["path"] = std::string("sub/a.txt\0x", 11);
    EXPECT_EQ(1001, run(1, nul)->GetError());
    Json::Value longName(Json::objectValue);
    longName["path"] = std::string(2000, 'a');
    EXPECT_EQ(1001, run(1, longName)->GetError());
    EXPECT_EQ(1001, run(1, Json::Value(Json::objectValue))->GetError());
}

}  // namespace
