#include "fakesession.h"

#include "callrecord.h"

FakeSession::FakeSession(const QString &id, const QString &userName, CallRecord *record, QObject *parent)
    : QObject(parent)
    , m_id(id)
    , m_userName(userName)
    , m_record(record)
{
}

QString FakeSession::name() const
{
    m_record->add(QStringLiteral("GetName ") + m_id);
    return m_userName;
}
