// Fuzz target: the groups file as the group list reads it, then writes it back.
#include "fuzzroot.h"
#include "grouplistmanager.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (!fuzzRoot().writeFile(QStringLiteral("/var/lib/libkest-iam/groups.txt"), fuzzInput(data, size)))
        return 0;
    GroupListManager groups;
    groups.groupsOfUser(QStringLiteral("@alice"));
    groups.addUserToGroup(QStringLiteral("kest"), QStringLiteral("@alice"));
    groups.removeDomainMembers();
    return 0;
}
