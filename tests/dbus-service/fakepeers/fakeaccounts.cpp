#include "fakeaccounts.h"

#include "callrecord.h"

FakeAccounts::FakeAccounts(CallRecord *record, QObject *parent)
    : QObject(parent)
    , m_record(record)
{
}

void FakeAccounts::DeleteUser(const QString &name, bool removeFiles)
{
    m_record->add(QStringLiteral("DeleteUser ") + name + QLatin1Char(' ')
        + (removeFiles ? QStringLiteral("true") : QStringLiteral("false")));
    if (m_record->fails(QStringLiteral("DeleteUser")))
        sendErrorReply(QStringLiteral("com.nimbal.kest.test.Failed"), QStringLiteral("DeleteUser failed on request"));
}
