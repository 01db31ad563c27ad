#include "fakelockservice.h"

#include "callrecord.h"

FakeLockService::FakeLockService(CallRecord *record, QObject *parent)
    : QObject(parent)
    , m_record(record)
{
}

void FakeLockService::SwitchToUser(const QString &target)
{
    m_record->add(QStringLiteral("SwitchToUser ") + target);
    if (m_record->fails(QStringLiteral("SwitchToUser")))
        sendErrorReply(QStringLiteral("com.nimbal.kest.test.Failed"), QStringLiteral("SwitchToUser failed on request"));
}
