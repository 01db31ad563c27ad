#pragma once

#include <QDBusConnection>
#include <QProcess>
#include <QString>
#include <QStringList>
#include <QTemporaryDir>

// One run of the real dbus-kest executable, with the test root and the private bus of the test process and
// a temporary directory of its own for the single-instance guard (QSharedMemory keys live in TMPDIR).
class ServiceProcess
{
public:
    // Processes sharing guardDirectory compete for one guard; empty: a directory of its own.
    explicit ServiceProcess(const QString &guardDirectory = QString());
    ~ServiceProcess();
    ServiceProcess(const ServiceProcess &) = delete;
    ServiceProcess &operator=(const ServiceProcess &) = delete;

    static QString program();
    static QString serviceName();

    QString guardDirectory() const;
    void setArguments(const QStringList &arguments);
    // Runs the service through a wrapper, e.g. setpriv to drop root.
    void setWrapper(const QStringList &wrapper);
    void setSearchPath(const QString &path);
    void setGuardDirectory(const QString &directory);

    bool start();
    // Until the service owns its name on the bus.
    bool waitUntilServing(const QDBusConnection &bus, int timeoutMs = 15000);
    bool signal(int signalNumber);
    bool waitForExit(int timeoutMs = 15000);
    bool isRunning() const;
    // The process id of the last start, also after the process ended.
    qint64 pid() const;
    int exitCode() const;
    QProcess::ExitStatus exitStatus() const;
    QString errorText() const;

    // Stops the service (SIGTERM) and waits; true when it ended with status 15.
    bool stop();

private:
    QTemporaryDir m_ownGuardDirectory;
    QString m_guardDirectory;
    QStringList m_arguments;
    QStringList m_wrapper;
    QString m_searchPath;
    QProcess m_process;
    qint64 m_pid = 0;
};

// Removes a single-instance segment that a killed service may have left behind in the directory.
void releaseLeftoverGuard(const QString &guardDirectory);
