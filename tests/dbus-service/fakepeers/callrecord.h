#pragma once

#include <QSet>
#include <QString>
#include <QStringList>

// Every call the fake peers received, one line each ("DeleteUser @alice true"), and the members told to fail.
class CallRecord
{
public:
    void add(const QString &line);
    QStringList lines() const;
    void clear();

    void failMember(const QString &member);
    bool fails(const QString &member) const;

private:
    QStringList m_lines;
    QSet<QString> m_failing;
};
