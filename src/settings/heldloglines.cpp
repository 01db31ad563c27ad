#include "heldloglines.h"

#include <syslog.h>

namespace
{
thread_local HeldLogLines *holder = nullptr;

void writeLine(int priority, const QByteArray &text)
{
    syslog(priority, "%s", text.constData());
}
} // namespace

HeldLogLines::HeldLogLines()
    : m_outermost(holder == nullptr)
{
    if (m_outermost)
        holder = this;
}

HeldLogLines::~HeldLogLines()
{
    if (!m_outermost)
        return;
    flush();
    holder = nullptr;
}

bool HeldLogLines::hold(int priority, const QByteArray &text)
{
    if (!holder)
        return false;
    holder->m_lines.append({ priority, text });
    return true;
}

void HeldLogLines::flush()
{
    if (!holder)
        return;
    for (const auto &[priority, text] : qAsConst(holder->m_lines))
        writeLine(priority, text);
    holder->m_lines.clear();
}
