#pragma once

#include <QByteArray>
#include <QList>
#include <QPair>

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
    static bool hold(int priority, const QByteArray &text);
    // Writes what is held now, as before a line that must not wait.
    static void flush();

private:
    bool m_outermost;
    QList<QPair<int, QByteArray>> m_lines;
};
