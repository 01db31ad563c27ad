#pragma once

#include <QByteArray>
#include <QList>

// Test double for syslog(3): linked into a test, it records every line instead of sending it.
struct SyslogLine {
    int priority;
    QByteArray text;
};

class SyslogCapture
{
public:
    static void clear();
    static QList<SyslogLine> lines();
    // Lines whose text contains the fragment.
    static QList<SyslogLine> matching(const QByteArray &fragment);
    static int count(const QByteArray &fragment) { return matching(fragment).size(); }
};
