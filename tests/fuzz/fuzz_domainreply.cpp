// Fuzz target: an answer of the domain server as the client reads it off the wire (HTTP framing),
// then validated as a user object and taken into the user list and cache.
#include "fuzzroot.h"
#include "grouplistmanager.h"
#include "httpreplyreader.h"
#include "kestcacheservice.h"
#include "userlistmanager.h"

#include <QJsonObject>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    fuzzRoot();
    if (size < 1)
        return 0;
    // The first byte cuts the rest into the pieces the network would deliver.
    const int piece = data[0] + 1;
    const QByteArray bytes = fuzzInput(data + 1, size - 1);
    HttpReplyReader reader(64 * 1024);
    for (int offset = 0; offset < bytes.size() && reader.state() == HttpReplyReader::State::Incomplete; offset += piece)
        reader.feed(bytes.mid(offset, piece));
    reader.finish();
    const bool framed = reader.state() == HttpReplyReader::State::Complete;
    QJsonObject user;
    if (KestCacheService::validateServerAnswer(
            QString::fromUtf8(framed ? reader.body() : bytes), QStringLiteral("password"), user)) {
        GroupListManager groups;
        UserListManager(&groups).addUser(user);
    }
    return 0;
}
