#pragma once

#include <QByteArray>
#include <QJsonObject>
#include <QProcess>
#include <QString>
#include <QStringList>

// The real cache-kest daemon as a child process in the current test root (KEST_IAM_ROOT), and the
// ways its clients reach it: framed requests over TCP.
class CacheDaemonFixture
{
public:
    ~CacheDaemonFixture() { stop(); }

    static QString programPath();
    static QByteArray frame(const QByteArray &payload);
    static QByteArray functionCall(const QString &name, const QStringList &argv);

    struct Run {
        int status = -1; // -1: did not end normally in time
        QByteArray out;
        QByteArray err;
        QJsonObject json() const;
    };
    // The daemon's command line, as root or under another uid without groups.
    static Run run(const QStringList &arguments, uint uid = 0);

    // Starts the daemon and waits until its pid file names the port it listens on.
    bool start();
    // SIGTERM; returns the exit code, or -1 when it did not end normally in time.
    int stop();
    bool isRunning() const { return m_daemon.state() == QProcess::Running; }
    quint16 port() const { return m_port; }
    qint64 processId() const { return m_daemon.processId(); }
    QString errorText() const { return m_error; }

    // One request on a new connection; the reply's payload, or a null array when none came in time.
    QByteArray request(const QByteArray &payload) const;
    QByteArray call(const QString &name, const QStringList &argv) const { return request(functionCall(name, argv)); }
    // The same from a child process running under another user id; the payload of the reply, or empty.
    QByteArray requestAsUser(uint uid, const QByteArray &payload) const;

private:
    QProcess m_daemon;
    quint16 m_port = 0;
    QString m_error;
};
