#pragma once

#include <QByteArray>
#include <QProcess>
#include <QString>
#include <QStringList>

// The real cache-kest daemon as a child process in the current test root (KEST_IAM_ROOT), and the
// ways its clients reach it: framed requests over TCP and the cache-kest command line.
class CacheDaemonFixture
{
public:
    CacheDaemonFixture() = default;
    ~CacheDaemonFixture();
    CacheDaemonFixture(const CacheDaemonFixture &) = delete;
    CacheDaemonFixture &operator=(const CacheDaemonFixture &) = delete;

    static QString programPath();
    static QByteArray frame(const QByteArray &payload);
    static QByteArray functionCall(const QString &name, const QStringList &argv);

    // Starts the daemon and waits until its pid file names the port it listens on.
    bool start();
    // SIGTERM; returns the exit code, or -1 when it did not end in time.
    int stop();
    bool isRunning() const;
    quint16 port() const;
    qint64 pid() const;
    QString errorText() const;

    // One request on a new connection; the reply's payload, or a null array when none came in time.
    QByteArray request(const QByteArray &payload, int timeoutMs = 20000) const;
    QByteArray call(const QString &name, const QStringList &argv) const;
    // Runs the cache-kest command line; returns its exit code (-1 when it did not finish).
    int runClient(const QStringList &arguments, QByteArray *out = nullptr, QByteArray *err = nullptr) const;

private:
    QProcess m_daemon;
    quint16 m_port = 0;
    QString m_error;
};
