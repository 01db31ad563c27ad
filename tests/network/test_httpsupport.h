#pragma once

#include "syslogcapture.h"

#include <QRegularExpression>
#include <QStringList>
#include <QTcpServer>

// Helpers shared by the tests of the domain server client.
namespace HttpTestSupport
{

// Warning lines logged so far, without the "cpu time: N, " prefix of the message handler.
inline QStringList warnings()
{
    static const QRegularExpression prefix(QStringLiteral("^cpu time: \\d+, "));
    QStringList result;
    const QList<SyslogLine> lines = SyslogCapture::lines();
    for (const SyslogLine &line : lines) {
        if (line.priority == 4)
            result << QString::fromUtf8(line.text).remove(prefix);
    }
    return result;
}

// Empty when the warnings logged so far are the expected ones (an expected line ending in "*" is a
// prefix); otherwise both lists, for QCOMPARE(warningMismatch(...), QString()) to show.
inline QString warningMismatch(const QStringList &expected)
{
    const QStringList actual = warnings();
    bool same = actual.size() == expected.size();
    for (int i = 0; same && i < actual.size(); ++i) {
        const QString &wanted = expected.at(i);
        same = wanted.endsWith(QLatin1Char('*')) ? actual.at(i).startsWith(wanted.chopped(1)) : actual.at(i) == wanted;
    }
    if (same)
        return QString();
    return QStringLiteral("logged:\n  ") + actual.join(QStringLiteral("\n  ")) + QStringLiteral("\nexpected:\n  ")
        + expected.join(QStringLiteral("\n  "));
}

// A port of 127.0.0.2 on which nothing listens (it was free a moment ago).
inline quint16 closedPort()
{
    QTcpServer probe;
    if (!probe.listen(QHostAddress(QStringLiteral("127.0.0.2")), 0))
        return 0;
    const quint16 port = probe.serverPort();
    probe.close();
    return port;
}

} // namespace HttpTestSupport
