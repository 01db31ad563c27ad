#pragma once

#include <QProcess>
#include <QString>
#include <QStringList>
#include <QTemporaryDir>

// A private dbus-daemon acting as the system bus: its address is exported as DBUS_SYSTEM_BUS_ADDRESS.
class PrivateBus
{
public:
    enum class Policy {
        Open, // anyone may own any name and call anything
        System, // like the machine's system bus: only root owns names; policy files decide the rest
    };

    explicit PrivateBus(Policy policy = Policy::Open, const QStringList &policyFiles = QStringList());
    ~PrivateBus();
    PrivateBus(const PrivateBus &) = delete;
    PrivateBus &operator=(const PrivateBus &) = delete;

    bool isRunning() const { return !m_address.isEmpty() && m_daemon.state() == QProcess::Running; }
    // Lets processes of other users reach the bus socket (its directory is private to root otherwise).
    bool openToOtherUsers();
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
