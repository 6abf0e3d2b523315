// The ids of the calling process as JSON, for the identity tests and the
// test handler that reports them: {"uid": [real, effective, saved], "gid":
// [real, effective, saved], "groups": [supplementary groups, sorted]}, as
// JSON integers; an empty object when they cannot be read.
#pragma once

#include <algorithm>
#include <json/json.h>
#include <unistd.h>
#include <vector>

inline Json::Value ProcessIds()
{
    uid_t u[3];
    gid_t g[3];
    Json::Value ids(Json::objectValue);
    if (getresuid(&u[0], &u[1], &u[2]) != 0 || getresgid(&g[0], &g[1], &g[2]) != 0) {
        return ids;
    }
    for (int i = 0; i < 3; ++i) {
        ids["uid"].append(static_cast<Json::Int>(u[i]));
        ids["gid"].append(static_cast<Json::Int>(g[i]));
    }
    std::vector<gid_t> groups(static_cast<size_t>(getgroups(0, nullptr)));
    groups.resize(static_cast<size_t>(getgroups(static_cast<int>(groups.size()), groups.data())));
    std::sort(groups.begin(), groups.end());
    ids["groups"] = Json::Value(Json::arrayValue);
    for (gid_t group : groups) {
        ids["groups"].append(static_cast<Json::Int>(group));
    }
    return ids;
}
