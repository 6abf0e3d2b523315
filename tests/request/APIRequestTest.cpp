#include <gtest/gtest.h>
#include <memory>

#include "request/APIRequestPrivate.h"
#include "support/ParamTestUtil.h"
#include "webapi/APIRequest.h"

using VELA::APIRequest;

namespace {

void ExpectEmpty(const APIRequest& r)
{
    EXPECT_FALSE(r.HasEnv("REQUEST_METHOD"));
    EXPECT_FALSE(r.HasParam("api"));
    EXPECT_FALSE(r.HasAttr("x"));
    EXPECT_FALSE(r.HasCookie("id"));
    EXPECT_EQ(0, r.GetAPIVersion());
    EXPECT_EQ("", r.GetAPIClass());
    EXPECT_EQ("", r.GetAPIMethod());
    EXPECT_EQ(VELA::REQUEST_METHOD_UNKNOWN, r.GetRequestMethod());
    EXPECT_EQ(AUTH_RESULT_NONE, r.GetAuthResult());
    EXPECT_TRUE(r.GetParam("", Json::Value()).empty());
}

}  // namespace

TEST(RequestConstruct, AnythingButANonEmptyObjectOfObjectsGivesAnEmptyRequest)
{
    for (const char* text : {"null", "{}", "[]", "[1,2]", "\"text\"", "7", "true"}) {
        SCOPED_TRACE(text);
        APIRequest r(J(text));
        ExpectEmpty(r);
    }
    // Members of the wrong type are ignored.
    APIRequest r(J(R"({"environ": [1], "getParam": "api=x", "postParam": 5, "reqLib": 3, "session": []})"));
    ExpectEmpty(r);
    EXPECT_EQ(Json::Value(Json::objectValue), r.GetAPIInfo("", Json::Value("d")));
}

// The environment keeps only strings; demonstration mode is never active.
TEST(RequestConstruct, EnvironKeepsOnlyStrings)
{
    APIRequest r(J(R"({"environ": {"REQUEST_METHOD": "GET", "CONTENT_LENGTH": 12, "X": null, "Y": {"a": 1},
                                   "DEMO": "1"}})"));
    EXPECT_FALSE(r.IsDemoMode());
    EXPECT_EQ("GET", r.GetEnv("REQUEST_METHOD").asString());
    EXPECT_FALSE(r.HasEnv("CONTENT_LENGTH"));
    EXPECT_FALSE(r.HasEnv("X"));
    EXPECT_FALSE(r.HasEnv("Y"));
    EXPECT_EQ(Json::Value("dflt"), r.GetEnv("CONTENT_LENGTH", "dflt"));
}

TEST(RequestConstruct, DeepAndHugeValuesAreKeptWithoutHarm)
{
    Json::Value deep;
    Json::Value* at = &deep;
    for (int i = 0; i < 2000; ++i) {
        at = &((*at)["n"]);
    }
    *at = 1;
    Json::Value request(Json::objectValue);
    request["getParam"]["deep"] = deep;
    request["getParam"]["big"] = std::string(1 << 20, 'x');
    request["getParam"]["webapi"] = deep;
    request["environ"]["HTTP_USER_AGENT"] = std::string(1 << 20, 'A');
    APIRequest r(request);
    EXPECT_TRUE(r.HasParam("deep"));
    EXPECT_EQ(size_t(1) << 20, r.GetParam("big").asString().size());
    EXPECT_FALSE(r.IsMobile());
}

TEST(RequestParam, BodyOverridesQuery)
{
    APIRequest r(J(R"({"getParam": {"api": "VELA.A", "version": 1, "method": "get", "q": 1},
                      "postParam": {"method": "set", "version": "3", "p": [1]}})"));
    EXPECT_EQ("set", r.GetParam("method").asString());
    EXPECT_EQ("set", r.GetAPIMethod());
    EXPECT_EQ("VELA.A", r.GetAPIClass());
    EXPECT_EQ(3, r.GetAPIVersion());  // decimal text from a form
    EXPECT_EQ(1, r.GetParam("q").asInt());
    EXPECT_EQ(J("[1]"), r.GetParam("p"));
}

TEST(RequestParam, OnlyAnIntegerOrExactDecimalTextIsAVersion)
{
    for (const char* v : {"2", R"("2")", R"("02")"}) {
        SCOPED_TRACE(v);
        APIRequest r(J(std::string(R"({"getParam": {"version": )") + v + "}}"));
        EXPECT_EQ(2, r.GetAPIVersion());
    }
    // Texts that merely look like 2 (blanks, sign, fraction), reals and
    // numbers outside int name no version, unlike other numbers sent as text.
    for (const char* v : {R"(" 2")", R"("2\t ")", R"("+2")", R"("2.9")", R"("2.0")", "2.5", R"("abc")", "[]", "{}",
                          "true", "99999999999", "-99999999999", R"("")", R"("1e0")", R"("0x1")", R"("1\u0000")"}) {
        SCOPED_TRACE(v);
        APIRequest r(J(std::string(R"({"getParam": {"version": )") + v + "}}"));
        EXPECT_EQ(0, r.GetAPIVersion());
    }
}

TEST(RequestParam, ResetKeepsTheApiIdentityMergeKeepsTheRest)
{
    APIRequest r(J(R"({"getParam": {"api": "VELA.A", "version": 2, "method": "get", "x": 1}})"));
    r.InitParam(J("{}"), true);
    EXPECT_FALSE(r.HasParam("x"));
    EXPECT_FALSE(r.HasParam("api"));
    EXPECT_EQ("VELA.A", r.GetAPIClass());
    EXPECT_EQ(2, r.GetAPIVersion());
    EXPECT_EQ("get", r.GetAPIMethod());

    // Without a reset earlier parameters stay; the caller's object is not
    // changed.
    APIRequest m(J(R"({"getParam": {"a": 1, "b": 2}})"));
    Json::Value request = J(R"({"getParam": {"__nEkOtReHpIc": "t", "__tXeTrEhPiC": ""}, "postParam": {"b": 3}})");
    const Json::Value before = request;
    m.InitParam(request, false);
    EXPECT_EQ(before, request);
    EXPECT_EQ(1, m.GetParam("a").asInt());
    EXPECT_EQ(3, m.GetParam("b").asInt());
}

TEST(RequestParam, ParamRefIsTheStoredValueOrTheDefaultItself)
{
    APIRequest r(J(R"({"getParam": {"a": {"k": 1}}})"));
    const Json::Value def("d");
    EXPECT_EQ(&def, &r.GetParamRef("missing", def));
    const Json::Value& a1 = r.GetParamRef("a", def);
    const Json::Value& a2 = r.GetParamRef("a", def);
    EXPECT_EQ(&a1, &a2);
    EXPECT_EQ(1, a1["k"].asInt());
}

TEST(RequestSession, SecondSessionReplacesTheFirstAndItsVerdict)
{
    APIRequest r(J(R"({"session": {"username": "a", "isAdmin": true}})"));
    r.SetAuthResult(AUTH_RESULT_AUTHORIZED);
    EXPECT_EQ(AUTH_RESULT_AUTHORIZED, r.GetAuthResult());
    r.InitSession(J(R"({"timeout": 5})"));
    EXPECT_EQ("", r.GetLoginUserName());
    EXPECT_FALSE(r.IsAdmin());
    EXPECT_EQ(5, r.GetTimeoutDuration());
    EXPECT_EQ(AUTH_RESULT_NONE, r.GetAuthResult());

    // So does new API info the description.
    APIRequest d(J(R"({"reqLib": {"lib": "a.so", "methods": {"1": ["get"]}}})"));
    EXPECT_EQ("a.so", d.GetAPIInfo("lib").asString());
    d.InitAPIInfo(J(R"({"other": 1})"));
    EXPECT_FALSE(d.GetAPIInfo("lib", Json::Value(false)).asBool());
    EXPECT_EQ(J(R"({"other": 1})"), d.GetAPIInfo(""));
}

TEST(RequestAttrAndCookie, AnyTypeOrStringsButNoEmptyName)
{
    APIRequest r;
    EXPECT_TRUE(r.SetAttr("n", 5));
    EXPECT_TRUE(r.SetAttr("o", J(R"({"a": [1]})")));
    EXPECT_TRUE(r.SetAttr("z", Json::Value()));
    EXPECT_FALSE(r.SetAttr("", 1));
    EXPECT_TRUE(r.HasAttr("z"));
    EXPECT_EQ(J(R"({"a": [1]})"), r.GetAttr("o"));

    // Cookies: only strings can be stored through SetCookie; a non-string
    // reaches the store only through the private side, and reads as the
    // default.
    r.GetPrivate()->SetData("cookie", "n", Json::Value(5), false);
    EXPECT_TRUE(r.HasCookie("n"));
    EXPECT_EQ("dflt", r.GetCookie("n", "dflt"));
    EXPECT_TRUE(r.SetCookie("s", "v"));
    EXPECT_EQ("v", r.GetCookie("s", "dflt"));
    EXPECT_FALSE(r.SetCookie("", "v"));
}

TEST(RequestCopy, CopiesShareNothing)
{
    APIRequest a(J(R"({"environ": {"HTTP_HOST": "h:1", "HTTP_X_VELA_SHARING": "link"},
                      "getParam": {"api": "VELA.A", "version": 4, "method": "m"}})"));
    EXPECT_EQ("h", a.GetURLHost(""));  // derive and freeze before copying
    APIRequest b(a);
    EXPECT_TRUE(b.SetAttr("k", 1));
    b.InitParam(J(R"({"getParam": {"api": "VELA.B"}})"), true);
    b.SetCookie("id", "x");
    EXPECT_FALSE(a.HasAttr("k"));
    EXPECT_EQ("VELA.A", a.GetAPIClass());
    EXPECT_EQ("VELA.B", b.GetAPIClass());
    EXPECT_EQ(4, b.GetAPIVersion());
    EXPECT_TRUE(a.HasParam("method"));
    EXPECT_FALSE(a.HasCookie("id"));
    EXPECT_EQ("h", b.GetURLHost(""));
    EXPECT_EQ("link", b.GetSharingID());
    EXPECT_TRUE(b.IsSharing());
    EXPECT_EQ(&b, b.GetPrivate()->owner);
}

// The typed getters: GetAndCheck*.
namespace VELA {
namespace {

using Test::Flags;

const APIRequest::PARAM_NECESSITY REQ = APIRequest::REQUIRED;
const APIRequest::PARAM_NECESSITY OPT = APIRequest::OPTIONAL;

// A request whose parameters are the JSON object `params`.
std::unique_ptr<APIRequest> Request(const std::string& params)
{
    Json::Value request(Json::objectValue);
    request["getParam"] = J(params);
    return std::unique_ptr<APIRequest>(new APIRequest(request));
}

bool Positive(long long const& v) { return v > 0; }

TEST(GetAndCheck, BasicAndIntegralTypes)
{
    auto req = Request(R"({"i":5,"s":"5","b":true,"r":3,"big":2147483648,"a":[1],"o":{"k":"v"}})");
    EXPECT_EQ(req->GetAndCheckInt("i", REQ).Get(), 5);
    EXPECT_EQ(Flags(req->GetAndCheckInt("s", REQ)), "SI");
    EXPECT_EQ(Flags(req->GetAndCheckInt("big", OPT)), "SI");
    EXPECT_EQ(req->GetAndCheckString("s", REQ).Get(), "5");
    EXPECT_EQ(Flags(req->GetAndCheckString("i", REQ)), "SI");
    EXPECT_TRUE(req->GetAndCheckBool("b", REQ).Get(false));
    EXPECT_EQ(Flags(req->GetAndCheckBool("s", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckReal("r", REQ).Get(), 3.0);
    EXPECT_EQ(Flags(req->GetAndCheckReal("b", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckArray("a", REQ).Get(), J("[1]"));
    EXPECT_EQ(Flags(req->GetAndCheckArray("o", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckObject("o", REQ).Get(), J(R"({"k":"v"})"));
    EXPECT_EQ(Flags(req->GetAndCheckObject("a", REQ)), "SI");

    // Integral types of every width, with a validator.
    req = Request(R"({"big":2147483648,"neg":-1,"zero":0,"huge":18446744073709551615})");
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("big", REQ).Get(), 2147483648LL);
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("neg", REQ).Get(), -1);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<long long>("huge", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckIntegral<unsigned int>("big", REQ).Get(), 2147483648u);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<unsigned int>("neg", REQ)), "SI");
    EXPECT_EQ(req->GetAndCheckIntegral<unsigned long long>("huge", REQ).Get(), 18446744073709551615ULL);
    EXPECT_EQ(Flags(req->GetAndCheckIntegral<unsigned long long>("neg", REQ)), "SI");

    APIParameter<long long> zero = req->GetAndCheckIntegral<long long>("zero", REQ, Positive);
    EXPECT_EQ(Flags(zero), "SI");
    EXPECT_EQ(zero.Get(5), 5);
    EXPECT_EQ(req->GetAndCheckIntegral<long long>("big", REQ, Positive).Get(5), 2147483648LL);
}

TEST(GetAndCheck, MissingAndNull)
{
    auto req = Request(R"({"z":null})");
    APIParameter<int> required = req->GetAndCheckInt("n", REQ);
    EXPECT_EQ(Flags(required), "I");
    EXPECT_EQ(required.Get(9), 9);
    APIParameter<std::string> optional = req->GetAndCheckString("n", OPT);
    EXPECT_EQ(Flags(optional), "");
    EXPECT_TRUE(optional.SetDefault("d"));
    EXPECT_EQ(optional.Get(), "d");
    EXPECT_EQ(Flags(req->GetAndCheckObject("z", REQ)), "SR");
}

bool IsPair(Json::Value const& v) { return v.size() == 2; }

TEST(GetAndCheckUnitArray, WrapsSingleValues)
{
    auto req = Request(R"({"s":"a","z":null,"a":["x","y"],"o":{"k":1}})");
    APIParameter<Json::Value> single = req->GetAndCheckUnitArray("s", REQ);
    EXPECT_EQ(Flags(single), "S");
    EXPECT_EQ(single.Get(), J(R"(["a"])"));
    APIParameter<Json::Value> null = req->GetAndCheckUnitArray("z", REQ);
    EXPECT_EQ(Flags(null), "S");
    EXPECT_EQ(null.Get(), J("[null]"));
    EXPECT_EQ(req->GetAndCheckUnitArray("a", REQ).Get(), J(R"(["x","y"])"));
    EXPECT_EQ(req->GetAndCheckUnitArray("o", REQ).Get(), J(R"([{"k":1}])"));

    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("n", REQ)), "I");
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("n", OPT)), "");
    // The validator sees the wrapped array.
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("s", REQ, IsPair)), "SI");
    EXPECT_EQ(Flags(req->GetAndCheckUnitArray("a", REQ, IsPair)), "S");
}

}  // namespace
}  // namespace VELA
