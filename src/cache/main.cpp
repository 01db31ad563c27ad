// Entry of cache-kest: the cache daemon without arguments, its command-line client with them.
#include "common.h"
#include "globalsetting.h"
#include "kestcacheclient.h"
#include "kestcachelocalserver.h"
#include "kestcacheservice.h"
#include "kestpaths.h"
#include "messagehandler.h"
#include "terminatesignalnotifier.h"

#include <QCommandLineParser>
#include <QCoreApplication>
#include <QDebug>
#include <QFile>
#include <QHostAddress>
#include <QSaveFile>
#include <QTextStream>
#include <QTimer>

#include <csignal>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace
{
const int replyTimeoutMs = 30000;
bool writePidFile(quint16 port)
{
    QSaveFile file(KestPaths::cachePidFile());
    if (!file.open(QIODevice::WriteOnly | QIODevice::Text))
        return false;
    file.write(QByteArray::number(qint64(getpid())) + '\n' + QByteArray::number(port) + '\n');
    file.setPermissions(
        QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther);
    return file.commit();
}

int runDaemon(QCoreApplication &app)
{
    if (getuid() != 0) {
        qWarning().noquote() << QStringLiteral("please run as root.");
        return 2;
    }
    const TerminateSignalNotifier terminate({ SIGTERM, SIGINT });
    if (!terminate.isValid())
        qWarning().noquote() << QStringLiteral("cannot install the terminate signal handler.");
    QObject::connect(&terminate, &TerminateSignalNotifier::received, &app, &QCoreApplication::quit);

    auto *service = new KestCacheService;
    KestCacheLocalServer server(service);
    const int port = GlobalSetting::instance()->port();
    if (!server.listen(QHostAddress(QStringLiteral("127.0.0.1")), quint16(port))) {
        qCritical().noquote() << QStringLiteral("cannot listen on 127.0.0.1:") + QString::number(port)
                + QStringLiteral(", error: ") + server.errorString();
        return 1;
    }
    // The modules find the daemon through the pid file: systemd hears of it only once both are there.
    if (!writePidFile(server.serverPort()))
        qWarning().noquote() << QStringLiteral("can not create pid file: ") + KestPaths::cachePidFile();
    else
        sd_notify(0, "READY=1");
    qInfo().noquote() << QStringLiteral("cache service started on port ") + QString::number(server.serverPort());
    service->startWorker();

    const int result = app.exec();
    sd_notify(0, "STOPPING=1");
    service->stopWorker();
    server.close();
    QFile::remove(KestPaths::cachePidFile());
    qInfo().noquote() << QStringLiteral("cache service stopped.");
    return result;
}

QByteArray readStandardInput()
{
    QFile input;
    if (!input.open(stdin, QIODevice::ReadOnly))
        return QByteArray();
    return input.read(KestCacheLocalServer::maximumFrameLength).trimmed();
}

quint16 daemonPort()
{
    unsigned short port = 0;
    if (QFile::exists(KestPaths::cachePidFile()) && read_port(&port))
        return port;
    return quint16(GlobalSetting::instance()->port());
}

int runClient(QCoreApplication &app, int command, const QByteArray &argument)
{
    QTextStream out(stdout);
    QTextStream err(stderr);
    if (command == 6)
        return KestCacheClient::showCache(argument, out, err) ? 0 : 1;

    KestCacheClient client;
    const quint16 port = daemonPort();
    if (!client.connectToServer(QStringLiteral("127.0.0.1"), port)) {
        err << "cannot connect to cache-kest on 127.0.0.1:" << port << Qt::endl;
        return 1;
    }
    QObject::connect(&client, &KestCacheClient::replyReceived, &app, [&](const QByteArray &payload, bool isJson) {
        if (!isJson) {
            err << "parse json error" << Qt::endl;
            app.exit(1);
            return;
        }
        out << QString::fromUtf8(payload) << Qt::endl;
        app.exit(0);
    });
    QTimer::singleShot(replyTimeoutMs, &app, [&]() {
        err << "no reply from cache-kest within " << replyTimeoutMs / 1000 << " s" << Qt::endl;
        app.exit(1);
    });
    client.sendCommand(command, argument);
    return app.exec();
}
} // namespace

int main(int argc, char *argv[])
{
    qInstallMessageHandler(messageHandler);
    QCoreApplication app(argc, argv);
    QCoreApplication::setApplicationName(QStringLiteral("cache-kest"));
    QCoreApplication::setApplicationVersion(QStringLiteral("1.0"));
    // No Qt plugins: the network bearer plugins would connect to the system bus at the first request,
    // and a stalled bus would then stall every login behind it.
    QCoreApplication::setLibraryPaths(QStringList());
    if (QCoreApplication::arguments().size() <= 1)
        return runDaemon(app);

    QCommandLineParser parser;
    parser.setApplicationDescription(QStringLiteral(
        "Without options: the kest-iam cache daemon. With one option: a command to the running daemon."));
    parser.addHelpOption();
    parser.addVersionOption();
    const QList<QPair<int, QCommandLineOption>> commands {
        { 1,
            QCommandLineOption(QStringLiteral("clean-cache"), QStringLiteral("Delete the cache record of UID."),
                QStringLiteral("UID")) },
        { 2,
            QCommandLineOption(QStringLiteral("clean-cache-not-in-list"),
                QStringLiteral("Delete every cache record whose uid is not in {\"whitelist\":[...]}."),
                QStringLiteral("JSON")) },
        { 3,
            QCommandLineOption(QStringLiteral("update-cache"), QStringLiteral("Refresh the cache record of UID."),
                QStringLiteral("UID")) },
        { 5,
            QCommandLineOption(QStringLiteral("modify-user-passwd"),
                QStringLiteral("Change a password: {\"username\",\"password\",\"old_password\"}, or - to read it "
                               "from standard input."),
                QStringLiteral("JSON")) },
        { 6,
            QCommandLineOption(QStringLiteral("show-cache"),
                QStringLiteral("Print the cache record of UID (read locally)."), QStringLiteral("UID")) },
    };
    for (const auto &command : commands)
        parser.addOption(command.second);
    parser.process(app);

    for (const auto &command : commands) {
        if (!parser.isSet(command.second))
            continue;
        QByteArray argument = parser.value(command.second).toUtf8();
        // "-": the JSON comes on standard input, so that no password stands on a command line.
        if (command.first == 5 && argument == "-")
            argument = readStandardInput();
        return runClient(app, command.first, argument);
    }
    QTextStream(stderr) << parser.helpText();
    return 1;
}
