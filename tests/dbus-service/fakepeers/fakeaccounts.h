#pragma once

#include <QDBusContext>
#include <QObject>

class CallRecord;

// The desktop accounts daemon's DeleteUser.
class FakeAccounts : public QObject, protected QDBusContext
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "com.nimbal.daemon.Accounts")

public:
    explicit FakeAccounts(CallRecord *record, QObject *parent = nullptr);

public Q_SLOTS:
    void DeleteUser(const QString &name, bool removeFiles);

private:
    CallRecord *m_record;
};
