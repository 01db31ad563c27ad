#include "dbuskestserviceuser.h"

#include <QDebug>

DBusKestServiceUser::DBusKestServiceUser(QObject *parent)
    : QObject(parent)
{
}

void DBusKestServiceUser::load(uint uid, const UserListManager &users)
{
    const UserEntryPtr entry = users.entryOfUid(uid);
    if (!entry) {
        qWarning().noquote() << QStringLiteral("There is no user that the id is uid.");
        return;
    }
    m_entry = entry;
}

uint DBusKestServiceUser::uid() const
{
    return m_entry ? m_entry->uid : 0;
}

uint DBusKestServiceUser::gid() const
{
    return m_entry ? m_entry->gid : 0;
}

QString DBusKestServiceUser::userName() const
{
    return m_entry ? m_entry->name : QString();
}

QString DBusKestServiceUser::password() const
{
    return m_entry ? m_entry->password : QString();
}

QString DBusKestServiceUser::homeDir() const
{
    return m_entry ? m_entry->home : QString();
}

QString DBusKestServiceUser::shell() const
{
    return m_entry ? m_entry->shell : QString();
}

QString DBusKestServiceUser::gecos() const
{
    return m_entry ? m_entry->gecos : QString();
}
