// Makes sharing links for the end-to-end tests through the platform's
// sharing store (VELA_ROOT chooses the system root):
//   sharing_link create PROJECT PATH USER   prints hash=<link id>
//   sharing_link session HASH IP            prints sid=<visitor session id>
//   sharing_link revoke HASH
// Exit status 0 on success, 1 when the store refused, 2 for bad usage.
#include <cstdio>
#include <pwd.h>
#include <string>

#include "vela/sharing.h"

using namespace VELA::sharing;

int main(int argc, char** argv)
{
    const std::string cmd = argc > 1 ? argv[1] : "";
    db::SharingDB& store = db::SharingDB::Instance();
    if (cmd == "create" && argc == 5) {
        const struct passwd* pw = getpwnam(argv[4]);
        if (pw == nullptr) {
            return 1;
        }
        db::LinkSpec link;
        link.projectName = argv[2];
        link.path = argv[3];
        link.uid = pw->pw_uid;
        link.userName = argv[4];
        record::Entry e;
        if (!db::EntryDB(store).Create(link, e)) {
            return 1;
        }
        printf("hash=%s\n", e.get_hash().c_str());
        return 0;
    }
    if (cmd == "session" && argc == 4) {
        record::Session s;
        record::Token t;
        if (db::SessionDB(store).Create(argv[2], "", argv[3], 0, s, t) != SHARING_STATUS_VALID) {
            return 1;
        }
        printf("sid=%s\n", s.get_session_id().c_str());
        return 0;
    }
    if (cmd == "revoke" && argc == 3) {
        return db::EntryDB(store).Revoke(argv[2]) ? 0 : 1;
    }
    fprintf(stderr, "usage: sharing_link create PROJECT PATH USER | session HASH IP | revoke HASH\n");
    return 2;
}
