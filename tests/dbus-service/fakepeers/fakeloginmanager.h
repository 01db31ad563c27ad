#pragma once

#include "dbuskesttypes.h"

#include <QDBusConnection>
#include <QDBusContext>
#include <QDBusObjectPath>
#include <QObject>

class CallRecord;

// The part of systemd-logind's manager that the front service uses, with sessions set up by the test.
class FakeLoginManager : public QObject, protected QDBusContext
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "org.freedesktop.login1.Manager")

public:
    FakeLoginManager(const QDBusConnection &connection, CallRecord *record, QObject *parent = nullptr);

    bool addSession(const QString &id, uint uid, const QString &userName, const QString &seat);
    bool announceSession(const QString &id);
    void removeSessions();

public Q_SLOTS:
    SessionList ListSessions();
    void KillSession(const QString &session_id, const QString &who, int signal_number);

Q_SIGNALS:
    void SessionNew(const QString &session_id, const QDBusObjectPath &object_path);

private:
    bool failedOnRequest(const QString &member);

    QDBusConnection m_connection;
    CallRecord *m_record;
    SessionList m_sessions;
};
