#pragma once

#include <QProcess>
#include <QString>
#include <QTemporaryDir>

// A private dbus-daemon acting as the system bus: its address is exported as DBUS_SYSTEM_BUS_ADDRESS.
class PrivateBus
{
public:
    // Without a policy file anyone may own any name and call anything. With one, like the machine's system bus:
    // only root owns names and the file decides the rest. Other users reach the socket by name but cannot list or
    // change its directory.
    explicit PrivateBus(const QString &policyFile = QString());
    ~PrivateBus();
    PrivateBus(const PrivateBus &) = delete;
    PrivateBus &operator=(const PrivateBus &) = delete;

    bool isRunning() const { return !m_address.isEmpty() && m_daemon.state() == QProcess::Running; }
    QString address() const { return m_address; }
    QString errorText() const { return m_error; }

private:
    QTemporaryDir m_dir;
    QProcess m_daemon;
    QString m_address;
    QString m_error;
    QByteArray m_previousAddress;
    bool m_hadPreviousAddress;
};
