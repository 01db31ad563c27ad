#pragma once

#include <QDBusConnection>
#include <QDBusMessage>
#include <QProcess>
#include <QString>
#include <QStringList>

// Runs kest-fake-peers (logind, accounts daemon, lock service) on the private system bus and drives it.
class FakePeers
{
public:
    FakePeers();
    ~FakePeers();
    FakePeers(const FakePeers &) = delete;
    FakePeers &operator=(const FakePeers &) = delete;

    // Starts the program and waits until it owns its names; the connection is used for the control calls.
    bool start(const QDBusConnection &bus);
    QString errorText() const;

    // Everything asked since the last reset, in order ("KillSession c2 all 9").
    QStringList calls() const;
    QStringList callsStartingWith(const QString &prefix) const;
    bool reset();
    bool addSession(
        const QString &id, uint uid, const QString &userName, const QString &seat = QStringLiteral("seat0"));
    bool emitSessionNew(const QString &id);
    bool failMethod(const QString &member);

private:
    QDBusMessage control(const QString &member, const QVariantList &arguments = QVariantList()) const;

    QProcess m_process;
    QDBusConnection m_bus;
    QString m_error;
};
