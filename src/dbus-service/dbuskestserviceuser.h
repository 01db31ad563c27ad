#pragma once

#include "userlistmanager.h"

#include <QObject>
#include <QString>

// The read-only account entry of one cached network user, published at /com/nimbal/kest/iam/user<uid>.
class DBusKestServiceUser : public QObject
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "com.nimbal.kest.iam.user")
    Q_PROPERTY(uint Uid READ uid)
    Q_PROPERTY(uint Gid READ gid)
    Q_PROPERTY(QString UserName READ userName)
    Q_PROPERTY(QString Password READ password)
    Q_PROPERTY(QString HomeDir READ homeDir)
    Q_PROPERTY(QString Shell READ shell)
    Q_PROPERTY(QString Gecos READ gecos)

public:
    explicit DBusKestServiceUser(QObject *parent = nullptr);

    // Takes the entry of the uid from the user list; keeps the previous entry when there is none.
    void load(uint uid, const UserListManager &users);

    // An object without an entry is still published, so every read answers 0 or empty text then.
    uint uid() const;
    uint gid() const;
    QString userName() const;
    QString password() const;
    QString homeDir() const;
    QString shell() const;
    QString gecos() const;

private:
    UserEntryPtr m_entry;
};
