// Opens the test handler library (VELA_TEST_HANDLER) with dlopen(), runs its
// functions on requests built from JSON and compares what they answered.
// Built, like the library, with nothing but include/, JsonCpp and the two
// framework libraries.
#include <dlfcn.h>
#include <gtest/gtest.h>
#include <json/json.h>
#include <memory>
#include <string>

#include "webapi/APIRequest.h"
#include "webapi/APIResponse.h"
#include "webapi/JsonUtil.h"

namespace {

typedef void (*HandlerFn)(VELA::APIRequest*, VELA::APIResponse*);

Json::Value Parse(const std::string& text)
{
    Json::Value out;
    EXPECT_TRUE(VELA::JsonParse(text, out)) << text;
    return out;
}

class HandlerLibrary : public ::testing::Test {
protected:
    void SetUp() override
    {
        lib_ = dlopen(VELA_TEST_HANDLER, RTLD_NOW | RTLD_LOCAL);
        ASSERT_NE(nullptr, lib_) << dlerror();
    }
    void TearDown() override
    {
        if (lib_ != nullptr) {
            EXPECT_EQ(0, dlclose(lib_)) << dlerror();
        }
    }

    // Runs the library's function `name` on the request JSON `request`.
    void Run(const char* name, const char* request)
    {
        const HandlerFn fn = reinterpret_cast<HandlerFn>(dlsym(lib_, name));
        ASSERT_NE(nullptr, fn) << name;
        req_.reset(new VELA::APIRequest(Parse(request)));
        resp_.reset(new VELA::APIResponse(req_.get()));
        fn(req_.get(), resp_.get());
    }

    void* lib_ = nullptr;
    std::unique_ptr<VELA::APIRequest> req_;
    std::unique_ptr<VELA::APIResponse> resp_;
};

// Each parameter the handler read answers [value, flags]: S set, R reset,
// I invalid, D default.
TEST_F(HandlerLibrary, TypedParameters)
{
    Run("HandlerParams", R"({"getParam": {
        "count": 5, "negative": -1, "wrongtype": "x", "enabled": true, "ratio": 0.5,
        "name": "disk1", "cleared": null, "ids": [1, 2], "opts": {"a": 1}, "paths": "single",
        "big": -9000000000, "mask": 4294967295, "size": 18446744073709551615}})");
    EXPECT_EQ(0, resp_->GetError());
    EXPECT_EQ(Parse(R"({"success": true, "data": {
        "count": [5, "S"], "negative": [-1, "SI"], "wrongtype": [0, "SI"], "enabled": [true, "S"],
        "ratio": [0.5, "S"], "name": ["disk1", "S"], "cleared": ["", "SR"], "missing_req": ["", "I"],
        "ids": [[1, 2], "S"], "opts": [{"a": 1}, "S"], "paths": [["single"], "S"], "limit": [7, "SD"],
        "big": [-9000000000, "S"], "mask": [4294967295, "S"], "size": [18446744073709551615, "S"]}})"),
              resp_->GetBody());
}

TEST_F(HandlerLibrary, Refusal)
{
    Run("HandlerRefuse", R"({"environ": {"HTTP_HOST": "nas"}})");
    EXPECT_EQ(Parse(R"({"success": false, "error": {"code": 105, "errors": {"reason": "not admin", "verdict": -4}}})"),
              resp_->GetBody());
    EXPECT_EQ(105, resp_->GetError());
    EXPECT_EQ(403, resp_->GetStatus());
    EXPECT_EQ("admin only", resp_->GetServerError());
    EXPECT_TRUE(resp_->HasServerError());
}

TEST_F(HandlerLibrary, LoginCookieHeadersAndRedirect)
{
    Run("HandlerLogin", R"({"environ": {"HTTPS": "on", "HTTP_HOST": "nas:5001"}, "getParam": {"client_time": 0}})");
    EXPECT_EQ(Parse(R"({"success": true, "data": {"injection_refused": true}})"), resp_->GetBody());
    EXPECT_EQ(Parse(R"(["id=s%201; path=/; expires=Thu, 01-Jan-1970 00:10:00 GMT; secure; httponly"])"),
              resp_->GetCookies());
    EXPECT_EQ("https://nas:5001/index.html", resp_->GetHeader("Location"));
    EXPECT_EQ(302, resp_->GetStatus());
    EXPECT_EQ("login", resp_->GetHeader("X-Handler"));
    EXPECT_FALSE(resp_->HasHeader("X-Evil"));
    EXPECT_EQ("application/json; charset=\"UTF-8\"", resp_->GetHeader("Content-type"));
}

}  // namespace
