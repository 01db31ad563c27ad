#pragma once

#include <QJsonObject>
#include <QString>

class KestCacheService;

// The daemon's state for an administrator: the service switch, the server and whether it is reached,
// the cache, and per account whether and until when it may log in offline. Built per request for one
// peer: the general part for anyone, the accounts for root and each user's own. Never a password or
// digest.
class StatusReport
{
public:
    // account: empty for every account the peer may see, else a name or a uid. peerUid -1: unknown peer.
    static QJsonObject build(const KestCacheService &service, qint64 peerUid, const QString &account);

    // Times travel as ISO 8601 in UTC, null for never.
    static QJsonValue timeValue(qint64 secondsSinceEpoch);
};
