#pragma once

#include <QDBusContext>
#include <QObject>

class CallRecord;

// The desktop lock service's SwitchToUser.
class FakeLockService : public QObject, protected QDBusContext
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "com.nimbal.ose.LockService")

public:
    explicit FakeLockService(CallRecord *record, QObject *parent = nullptr);

public Q_SLOTS:
    void SwitchToUser(const QString &target);

private:
    CallRecord *m_record;
};
