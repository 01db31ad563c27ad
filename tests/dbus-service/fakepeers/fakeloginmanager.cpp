#include "fakeloginmanager.h"

#include "callrecord.h"
#include "fakesession.h"

#include <QDBusMessage>

#include <memory>

namespace
{
const QString sessionRoot = QStringLiteral("/org/freedesktop/login1/session/");
}

FakeLoginManager::FakeLoginManager(const QDBusConnection &connection, CallRecord *record, QObject *parent)
    : QObject(parent)
    , m_connection(connection)
    , m_record(record)
{
}

bool FakeLoginManager::addSession(const QString &id, uint uid, const QString &userName, const QString &seat)
{
    const SessionInfo session { id, uid, userName, seat, QDBusObjectPath(sessionRoot + id) };
    auto object = std::make_unique<FakeSession>(id, userName, m_record);
    if (!m_connection.registerObject(session.sessionPath.path(), object.get(), QDBusConnection::ExportAllProperties))
        return false;
    object.release()->setParent(this);
    m_sessions.append(session);
    return true;
}

bool FakeLoginManager::announceSession(const QString &id)
{
    // A path of its own for an unknown id: the service must then cope with a session it cannot read.
    Q_EMIT SessionNew(id, QDBusObjectPath(sessionRoot + id));
    return true;
}

void FakeLoginManager::removeSessions()
{
    for (const SessionInfo &session : qAsConst(m_sessions))
        m_connection.unregisterObject(session.sessionPath.path());
    const QList<FakeSession *> objects = findChildren<FakeSession *>(QString(), Qt::FindDirectChildrenOnly);
    qDeleteAll(objects);
    m_sessions.clear();
}

SessionList FakeLoginManager::ListSessions()
{
    m_record->add(QStringLiteral("ListSessions"));
    if (failedOnRequest(QStringLiteral("ListSessions")))
        return SessionList();
    if (m_record->fails(QStringLiteral("ListSessionsGarbled"))) {
        // A reply of the wrong shape, which the caller cannot read as a session list.
        setDelayedReply(true);
        connection().send(message().createReply(QStringLiteral("not a session list")));
        return SessionList();
    }
    return m_sessions;
}

void FakeLoginManager::KillSession(const QString &session_id, const QString &who, int signal_number)
{
    m_record->add(QStringLiteral("KillSession ") + session_id + QLatin1Char(' ') + who + QLatin1Char(' ')
        + QString::number(signal_number));
    failedOnRequest(QStringLiteral("KillSession"));
}

bool FakeLoginManager::failedOnRequest(const QString &member)
{
    if (!m_record->fails(member))
        return false;
    sendErrorReply(QStringLiteral("com.nimbal.kest.test.Failed"), member + QStringLiteral(" failed on request"));
    return true;
}
