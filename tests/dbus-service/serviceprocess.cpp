#include "serviceprocess.h"

#include <QDBusConnectionInterface>
#include <QDeadlineTimer>
#include <QSharedMemory>
#include <QTest>

#include <csignal>

namespace
{
const int pollIntervalMs = 20;
}

ServiceProcess::ServiceProcess(const QString &guardDirectory)
    : m_guardDirectory(guardDirectory.isEmpty() ? m_ownGuardDirectory.path() : guardDirectory)
{
    m_process.setProcessChannelMode(QProcess::ForwardedChannels);
}

ServiceProcess::~ServiceProcess()
{
    if (isRunning()) {
        signal(SIGTERM);
        if (!m_process.waitForFinished(10000))
            m_process.kill();
        m_process.waitForFinished(5000);
    }
    releaseLeftoverGuard(m_guardDirectory);
}

QString ServiceProcess::program()
{
    return qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/dbus-service/dbus-kest");
}

QString ServiceProcess::serviceName()
{
    return QStringLiteral("com.nimbal.kest.iam");
}

QString ServiceProcess::guardDirectory() const
{
    return m_guardDirectory;
}

void ServiceProcess::setArguments(const QStringList &arguments)
{
    m_arguments = arguments;
}

void ServiceProcess::setWrapper(const QStringList &wrapper)
{
    m_wrapper = wrapper;
}

void ServiceProcess::setSearchPath(const QString &path)
{
    m_searchPath = path;
}

void ServiceProcess::setGuardDirectory(const QString &directory)
{
    m_guardDirectory = directory;
}

bool ServiceProcess::start()
{
    QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
    environment.insert(QStringLiteral("TMPDIR"), m_guardDirectory);
    if (!m_searchPath.isNull())
        environment.insert(QStringLiteral("PATH"), m_searchPath);
    m_process.setProcessEnvironment(environment);
    if (m_wrapper.isEmpty()) {
        m_process.setProgram(program());
        m_process.setArguments(m_arguments);
    } else {
        m_process.setProgram(m_wrapper.first());
        m_process.setArguments(m_wrapper.mid(1) + QStringList { program() } + m_arguments);
    }
    m_process.start();
    if (!m_process.waitForStarted(10000))
        return false;
    m_pid = m_process.processId();
    return true;
}

bool ServiceProcess::waitUntilServing(const QDBusConnection &bus, int timeoutMs)
{
    QDeadlineTimer deadline(timeoutMs);
    while (isRunning() && !deadline.hasExpired()) {
        const QDBusReply<uint> owner = bus.interface()->servicePid(serviceName());
        if (owner.isValid() && qint64(owner.value()) == pid())
            return true;
        QTest::qWait(pollIntervalMs);
    }
    return false;
}

bool ServiceProcess::signal(int signalNumber)
{
    return isRunning() && ::kill(pid_t(m_pid), signalNumber) == 0;
}

bool ServiceProcess::waitForExit(int timeoutMs)
{
    return m_process.state() == QProcess::NotRunning || m_process.waitForFinished(timeoutMs);
}

bool ServiceProcess::isRunning() const
{
    return m_process.state() != QProcess::NotRunning;
}

qint64 ServiceProcess::pid() const
{
    return m_pid;
}

int ServiceProcess::exitCode() const
{
    return m_process.exitCode();
}

QProcess::ExitStatus ServiceProcess::exitStatus() const
{
    return m_process.exitStatus();
}

QString ServiceProcess::errorText() const
{
    return m_process.errorString();
}

bool ServiceProcess::stop()
{
    if (!signal(SIGTERM) || !waitForExit())
        return false;
    return exitStatus() == QProcess::NormalExit && exitCode() == SIGTERM;
}

void releaseLeftoverGuard(const QString &guardDirectory)
{
    const QByteArray previous = qgetenv("TMPDIR");
    const bool hadPrevious = qEnvironmentVariableIsSet("TMPDIR");
    qputenv("TMPDIR", guardDirectory.toLocal8Bit());
    {
        // The key is turned into a file name in TMPDIR when it is set; the last detach removes the segment.
        QSharedMemory guard(QStringLiteral("dbus-kest"));
        if (guard.attach())
            guard.detach();
    }
    if (hadPrevious)
        qputenv("TMPDIR", previous);
    else
        qunsetenv("TMPDIR");
}
