#pragma once

#include <QDBusContext>
#include <QObject>
#include <QStringList>

class CallRecord;
class FakeLoginManager;

// What the tests use to set the fake peers up and to read back who was asked what.
class FakeControl : public QObject, protected QDBusContext
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "com.nimbal.kest.test.Peers")

public:
    FakeControl(CallRecord *record, FakeLoginManager *loginManager, QObject *parent = nullptr);

public Q_SLOTS:
    QStringList Calls();
    void Reset();
    void AddSession(const QString &id, uint uid, const QString &userName, const QString &seat);
    void EmitSessionNew(const QString &id);
    // Later calls of the member answer with an error ("ListSessionsGarbled": a reply of the wrong type).
    void FailMethod(const QString &member);

private:
    CallRecord *m_record;
    FakeLoginManager *m_loginManager;
};
