#include "heldloglines.h"

#include "messagehandler.h"

namespace
{
thread_local HeldLogLines *holder = nullptr;
} // namespace

HeldLogLines::HeldLogLines()
{
    if (!holder)
        holder = this;
}

HeldLogLines::~HeldLogLines()
{
    // An inner one leaves the lines to the outermost.
    if (holder != this)
        return;
    flush();
    holder = nullptr;
}

bool HeldLogLines::hold(QtMsgType type, unsigned long ticks, const QString &message)
{
    if (!holder)
        return false;
    holder->m_lines.append({ int(type), ticks, message });
    return true;
}

void HeldLogLines::flush()
{
    if (!holder)
        return;
    for (const Line &line : qAsConst(holder->m_lines))
        writeLogLine(QtMsgType(line.type), line.ticks, line.message);
    holder->m_lines.clear();
}
