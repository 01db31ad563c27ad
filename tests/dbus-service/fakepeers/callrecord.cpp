#include "callrecord.h"

void CallRecord::add(const QString &line)
{
    m_lines.append(line);
}

QStringList CallRecord::lines() const
{
    return m_lines;
}

void CallRecord::clear()
{
    m_lines.clear();
    m_failing.clear();
}

void CallRecord::failMember(const QString &member)
{
    m_failing.insert(member);
}

bool CallRecord::fails(const QString &member) const
{
    return m_failing.contains(member);
}
