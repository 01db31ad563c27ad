#pragma once

#include <QDBusArgument>
#include <QDBusObjectPath>
#include <QList>
#include <QMetaType>
#include <QString>

// D-Bus value types of the front service ("au", "(susso)", "a(susso)").

using UidList = QList<uint>;

// One row of logind's ListSessions reply.
struct SessionInfo {
    QString sessionId;
    uint userId = 0;
    QString userName;
    QString seatId;
    QDBusObjectPath sessionPath;
};

using SessionList = QList<SessionInfo>;

Q_DECLARE_METATYPE(SessionInfo)

inline QDBusArgument &operator<<(QDBusArgument &argument, const SessionInfo &session)
{
    argument.beginStructure();
    argument << session.sessionId << session.userId << session.userName << session.seatId << session.sessionPath;
    argument.endStructure();
    return argument;
}

inline const QDBusArgument &operator>>(const QDBusArgument &argument, SessionInfo &session)
{
    argument.beginStructure();
    argument >> session.sessionId >> session.userId >> session.userName >> session.seatId >> session.sessionPath;
    argument.endStructure();
    return argument;
}

// Registers UidList, SessionInfo and SessionList with the meta-type system and QtDBus, under those names.
void registerKestDBusTypes();
