// Entry of dbus-kest: the front service on the system bus.
#include "dbuskestservice.h"
#include "kestpaths.h"
#include "messagehandler.h"
#include "terminatesignalnotifier.h"
#include "wholefile.h"

#include <QCoreApplication>
#include <QDBusConnection>
#include <QDBusConnectionInterface>
#include <QDebug>
#include <QFile>
#include <QSharedMemory>
#include <QSharedPointer>
#include <QTimer>

#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <unistd.h>

namespace
{
const int kPidFileDelayMs = 5000;
const QString kServiceName = QStringLiteral("com.nimbal.kest.iam");
const QString kObjectPath = QStringLiteral("/com/nimbal/kest/iam");

// Process-global: the terminate path releases it outside main.
QSharedPointer<QSharedMemory> g_instanceGuard;
int g_terminatingSignal = 0;

void releaseInstanceGuard()
{
    if (!g_instanceGuard)
        return;
    g_instanceGuard->detach();
    g_instanceGuard.reset();
}

void leaveOnSignal(int signalNumber)
{
    qInfo().noquote() << QStringLiteral("received terminate signal. ") + QString::number(signalNumber);
    releaseInstanceGuard();
    g_terminatingSignal = signalNumber;
    QCoreApplication::exit(signalNumber);
}

void installTerminateHandler(QCoreApplication &app)
{
    // SIGKILL cannot be caught; the request is kept all the same.
    auto *notifier = new TerminateSignalNotifier({ SIGTERM, SIGKILL, SIGQUIT, SIGINT }, &app);
    if (!notifier->isValid())
        qWarning().noquote() << QStringLiteral("cannot install the terminate signal handler.");
    QObject::connect(notifier, &TerminateSignalNotifier::received, &app, leaveOnSignal);
}

// 0 once this process holds the guard, else the exit code.
int takeInstanceGuard()
{
    g_instanceGuard = QSharedPointer<QSharedMemory>::create(QCoreApplication::applicationName());
    if (g_instanceGuard->attach(QSharedMemory::ReadWrite)) {
        qDebug().noquote() << QStringLiteral("Open Another Instance is forbidden");
        return -1;
    }
    if (!g_instanceGuard->create(1, QSharedMemory::ReadWrite)) {
        qCritical().noquote() << QStringLiteral("cannot create share memory. code: ")
                + QString::number(g_instanceGuard->error()) + QStringLiteral(", ") + g_instanceGuard->errorString();
        g_instanceGuard.reset();
        return -4;
    }
    return 0;
}

void writePidFile()
{
    QFile file(KestPaths::dbusPidFile());
    if (file.exists() && !file.remove()) {
        qWarning().noquote() << QStringLiteral("can not remove invalid pid file.");
        std::exit(3);
    }
    QString error;
    if (!WholeFile::write(file.fileName(), QByteArray::number(qint64(getpid())),
            QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther,
            error)) {
        qWarning().noquote() << QStringLiteral("can not create pid file. error: ") + error;
        std::exit(3);
    }
    qInfo().noquote() << QStringLiteral("dbus kest service is started.");
}

QDBusError serviceRegistrationError(const QDBusConnection &connection)
{
    if (connection.lastError().isValid())
        return connection.lastError();
    return connection.interface() ? connection.interface()->lastError() : QDBusError();
}

// 0 once the name and every object are on the bus, else the exit code.
int registerOnBus(DBusKestService &service)
{
    QDBusConnection connection = QDBusConnection::systemBus();
    if (!connection.registerService(kServiceName)) {
        const QDBusError error = serviceRegistrationError(connection);
        qWarning().noquote() << QStringLiteral("register dbus service failed. error: ") + error.name()
                + QStringLiteral(", detail: ") + error.message();
        return -2;
    }
    if (!connection.registerObject(kObjectPath, &service, QDBusConnection::ExportAllContents)) {
        const QDBusError error = connection.lastError();
        qWarning().noquote() << QStringLiteral("register dbus object failed. error: ") + error.name()
                + QStringLiteral(", detail: ") + error.message();
        return -3;
    }
    if (!service.registerUserObjects(connection)) {
        qWarning().noquote() << QStringLiteral("register dbus object failed. error.");
        return -3;
    }
    return 0;
}
} // namespace

int main(int argc, char *argv[])
{
    qInstallMessageHandler(messageHandler);
    QCoreApplication app(argc, argv);
    QCoreApplication::setOrganizationName(QStringLiteral("Ardelvine"));
    QCoreApplication::setApplicationName(QStringLiteral("dbus-kest"));
    QCoreApplication::setApplicationVersion(QStringLiteral("1.0"));

    // Any argument means: idle without touching the bus, the guard or the pid file.
    if (argc > 1)
        return app.exec();

    installTerminateHandler(app);
    if (getuid() != 0) {
        qWarning().noquote() << QStringLiteral("please run as root.");
        return 2;
    }
    if (const int code = takeInstanceGuard())
        return code;
    QFile::remove(KestPaths::dbusPidFile());

    DBusKestService service;
    if (const int code = registerOnBus(service))
        return code;
    qInfo().noquote() << QStringLiteral("dbus service started.");
    QTimer::singleShot(kPidFileDelayMs, Qt::CoarseTimer, writePidFile);

    const int result = app.exec();
    // A terminate signal has released the guard already and leaves the pid file for the next start.
    if (g_terminatingSignal != 0)
        return result;
    releaseInstanceGuard();
    QFile::remove(KestPaths::dbusPidFile());
    return result;
}
