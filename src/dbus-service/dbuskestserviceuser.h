#pragma once

#include "userlistmanager.h"

#include <QDBusVirtualObject>
#include <QString>
#include <QVariantMap>

// The read-only account entry of one cached network user, published at /com/nimbal/kest/iam/user<uid>.
// Its properties are served by hand, not by QtDBus, because what Password shows depends on the caller.
class DBusKestServiceUser : public QDBusVirtualObject
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

    QString introspect(const QString &path) const override;
    bool handleMessage(const QDBusMessage &message, const QDBusConnection &connection) override;

    static const QString interfaceName;

private:
    QVariantMap properties(bool withPassword) const;
    bool callerMayReadPassword(const QDBusMessage &message, const QDBusConnection &connection) const;

    UserEntryPtr m_entry;
};
