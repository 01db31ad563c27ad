#pragma once

#include <QList>
#include <QString>

// While one lives, the log lines of its thread are held and then written in order when it ends: the cache
// daemon answers first and logs after, so that no client waits on the system log.
class HeldLogLines
{
public:
    HeldLogLines();
    ~HeldLogLines();
    HeldLogLines(const HeldLogLines &) = delete;
    HeldLogLines &operator=(const HeldLogLines &) = delete;

    // False when nothing holds this thread's lines: the caller writes the line itself.
    static bool hold(QtMsgType type, unsigned long ticks, const QString &message);
    // Writes what is held now, as before a line that must not wait.
    static void flush();

private:
    struct Line {
        int type; // as given: a message type beyond the enumeration is logged as a notice
        unsigned long ticks;
        QString message;
    };
    QList<Line> m_lines;
};
