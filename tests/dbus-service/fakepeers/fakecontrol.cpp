#include "fakecontrol.h"

#include "callrecord.h"
#include "fakeloginmanager.h"

FakeControl::FakeControl(CallRecord *record, FakeLoginManager *loginManager, QObject *parent)
    : QObject(parent)
    , m_record(record)
    , m_loginManager(loginManager)
{
}

QStringList FakeControl::Calls()
{
    return m_record->lines();
}

void FakeControl::Reset()
{
    m_record->clear();
    m_loginManager->removeSessions();
}

void FakeControl::AddSession(const QString &id, uint uid, const QString &userName, const QString &seat)
{
    if (!m_loginManager->addSession(id, uid, userName, seat))
        sendErrorReply(QDBusError::InvalidArgs, QStringLiteral("cannot publish session ") + id);
}

void FakeControl::EmitSessionNew(const QString &id)
{
    m_loginManager->announceSession(id);
}

void FakeControl::FailMethod(const QString &member)
{
    m_record->failMember(member);
}
