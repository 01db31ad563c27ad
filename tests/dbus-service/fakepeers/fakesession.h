#pragma once

#include <QObject>
#include <QString>

class CallRecord;

// A logind session object; only its Name property is ever asked for.
class FakeSession : public QObject
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "org.freedesktop.login1.Session")
    Q_PROPERTY(QString Name READ name)

public:
    FakeSession(const QString &id, const QString &userName, CallRecord *record, QObject *parent = nullptr);

    QString name() const;

private:
    QString m_id;
    QString m_userName;
    CallRecord *m_record;
};
