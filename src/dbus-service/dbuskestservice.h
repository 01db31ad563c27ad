#pragma once

#include "dbuskesttypes.h"

#include <QDBusConnection>
#include <QDBusContext>
#include <QDBusObjectPath>
#include <QMap>
#include <QObject>
#include <QSharedPointer>
#include <QString>
#include <QStringList>

class DBusKestServiceUser;
class QDBusInterface;

// The front service's main object, published at /com/nimbal/kest/iam. Every public slot and the Enable
// property are the D-Bus interface; plain members stay off the bus.
class DBusKestService : public QObject, protected QDBusContext
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "com.nimbal.kest.iam")
    Q_PROPERTY(bool Enable READ isEnabled WRITE setEnable)

public:
    explicit DBusKestService(
        const QDBusConnection &connection = QDBusConnection::systemBus(), QObject *parent = nullptr);
    ~DBusKestService() override;

    // The settings switch "enable" of group "main", read afresh.
    bool isEnabled() const;
    // Switching on empties the domain users' cache; switching off drops their desktop data and shows
    // the greeter.
    void setEnable(bool enable);

    // One object per cached uid; false at the first one the bus refuses, later uids are not tried.
    bool registerUserObjects(QDBusConnection connection);

    // Enables and starts, or disables and stops, the cache daemon's unit. Nothing on the bus reaches it.
    void controlCacheService(bool enable);

public Q_SLOTS:
    QString QueryPasswordConfig();
    UidList GetUserIdList();
    QStringList GetUserGroups(const QString &zusername);
    bool RemoveCacheFile(uint uid);
    bool RemoveCacheFilesNotInList(const UidList &whiteList);
    bool RemoveAllCacheFiles();
    bool DisableTerminal(uint uid);
    QString ModifyUserPassword(const QString &userName, const QString &old_password, const QString &newPassword);
    void SessionNew(const QString &sessionName, const QDBusObjectPath &path);

private:
    // Root and the account itself may change its password; callers from outside the bus are trusted.
    bool callerMayChangePassword(const QString &userName) const;
    void watchLoginSessions();
    void clearUserObjects();
    void syncLoginSessions();
    void killSession(const QString &sessionId);
    bool writeEnableSetting(bool enable) const;
    void deleteDomainUsersDesktopData();
    void deleteUserDesktopData(const QString &userName);
    void switchToGreeter();

    QDBusConnection m_connection;
    QMap<uint, QSharedPointer<DBusKestServiceUser>> m_users;
    QDBusInterface *m_loginManager = nullptr;
};
