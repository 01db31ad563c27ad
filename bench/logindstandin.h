#pragma once

#include <QSemaphore>
#include <QString>
#include <QThread>

// A stand-in for systemd-logind on the private bus, answering from a thread of its own so that the
// benchmark may wait on dbus-kest while dbus-kest asks it for a session's user name.
class LogindStandIn : public QThread
{
public:
    ~LogindStandIn() override;
    // Starts the thread and returns once the name is owned on the bus at that address.
    bool begin(const QString &address);

protected:
    void run() override;

private:
    bool m_owned = false;
    QString m_address;
    QSemaphore m_ready;
};
