#pragma once

#include <QJsonObject>
#include <QString>

// The status command's side of the status reply: the lines an administrator reads, and the exit
// status a script or a monitor tests.
class StatusPrinter
{
public:
    // 0 online, 1 offline but answering from the cache, 2 switched off (or no status at all).
    static int exitStatus(const QJsonObject &status);
    static QString text(const QJsonObject &status);
};
