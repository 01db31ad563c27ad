// Entry of cache-kest: the cache daemon without arguments, its command-line client with them.
#include "accountmappublisher.h"
#include "common.h"
#include "globalsetting.h"
#include "kestcacheclient.h"
#include "kestcachelocalserver.h"
#include "kestcacheservice.h"
#include "kestpaths.h"
#include "messagehandler.h"
#include "settingscheck.h"
#include "settingsfile.h"
#include "settingsschema.h"
#include "settingswatch.h"
#include "statusprinter.h"
#include "terminatesignalnotifier.h"
#include "wholefile.h"

#include <QCommandLineParser>
#include <QCoreApplication>
#include <QDebug>
#include <QFile>
#include <QHostAddress>
#include <QJsonDocument>
#include <QTextStream>
#include <QTimer>

#include <csignal>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace
{
const int replyTimeoutMs = 30000;
// Beside 1 (cannot listen) and 2 (not root): the settings name no usable port.
const int invalidPortStatus = 3;

// The port to listen on, or 0 after telling the log and standard error why there is none.
int checkedPort()
{
    QString problem;
    const int port = SettingsSchema::portValue(
        SettingsFile::value(QStringLiteral("main"), QStringLiteral("port"), 10080), &problem);
    if (port != 0)
        return port;
    const QString text = QStringLiteral("configuration error: [main] port: ") + problem + QStringLiteral(" in ")
        + KestPaths::settingsFile() + QStringLiteral("; cache-kest stops.");
    qCritical().noquote() << text;
    QTextStream(stderr) << text << Qt::endl;
    return 0;
}
bool writePidFile(quint16 port)
{
    QString error;
    return WholeFile::write(KestPaths::cachePidFile(),
        QByteArray::number(qint64(getpid())) + '\n' + QByteArray::number(port) + '\n',
        QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther, error);
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

    // What a crash left half-written never replaced anything: it can go.
    WholeFile::removeScratchFiles(KestPaths::workDir());
    SettingsWatch settingsWatch(KestPaths::settingsFile(), isatty(STDERR_FILENO) == 1);
    settingsWatch.start();
    const int port = checkedPort();
    if (port == 0)
        return invalidPortStatus;
    auto *service = new KestCacheService;
    KestCacheLocalServer server(service);
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
    AccountMapPublisher accountMap(service->userList(), service->negativeAnswers());
    QObject::connect(service, &KestCacheService::accountsWritten, &accountMap, &AccountMapPublisher::publish);
    QObject::connect(
        service, &KestCacheService::negativeAnswersChanged, &accountMap, &AccountMapPublisher::negativeAnswersChanged);
    QObject::connect(&app, &QCoreApplication::aboutToQuit, &accountMap, &AccountMapPublisher::dropNegativeAnswers);
    accountMap.publish();
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
        app.exit(KestCacheClient::isErrorReply(QJsonDocument::fromJson(payload).object()) ? 1 : 0);
    });
    QTimer::singleShot(replyTimeoutMs, &app, [&]() {
        err << "no reply from cache-kest within " << replyTimeoutMs / 1000 << " s" << Qt::endl;
        app.exit(1);
    });
    client.sendCommand(command, argument);
    return app.exec();
}
int runCheckConfig(const QStringList &files)
{
    const QString path = files.isEmpty() ? KestPaths::settingsFile() : files.first();
    const QList<SettingsFinding> findings = SettingsCheck::check(path);
    QTextStream out(stdout);
    for (const SettingsFinding &finding : findings)
        out << finding.text(path) << Qt::endl;
    return SettingsCheck::exitStatus(findings);
}

// Exit status 2 also when the daemon cannot be asked: not running is as bad as switched off.
int runStatus(QCoreApplication &app, const QString &account, bool json)
{
    QTextStream out(stdout);
    QTextStream err(stderr);
    const auto notRunning = [&](const QString &why) {
        if (json)
            out << R"({"running":false})" << Qt::endl;
        err << why << Qt::endl;
        return 2;
    };
    KestCacheClient client;
    const quint16 port = daemonPort();
    if (!client.connectToServer(QStringLiteral("127.0.0.1"), port))
        return notRunning(QStringLiteral("cache-kest is not running (nothing answers on 127.0.0.1:%1)").arg(port));
    int status = 2;
    QObject::connect(&client, &KestCacheClient::replyReceived, &app, [&](const QByteArray &payload, bool) {
        QJsonObject reply = QJsonDocument::fromJson(payload).object();
        if (KestCacheClient::isErrorReply(reply)) {
            err << reply.value(QLatin1String("errorMessage")).toString() << Qt::endl;
            app.exit(1);
            return;
        }
        reply.remove(QStringLiteral("retVal"));
        reply.remove(QStringLiteral("errorMessage"));
        reply.insert(QStringLiteral("running"), true);
        status = StatusPrinter::exitStatus(reply);
        out << (json ? QString::fromUtf8(QJsonDocument(reply).toJson(QJsonDocument::Indented))
                     : StatusPrinter::text(reply));
        out.flush();
        app.exit(0);
    });
    QTimer::singleShot(replyTimeoutMs, &app, [&]() { app.exit(-1); });
    client.sendCommand(KestCacheClient::statusCommand, account.toUtf8());
    const int result = app.exec();
    if (result < 0)
        return notRunning(QStringLiteral("no reply from cache-kest within %1 s").arg(replyTimeoutMs / 1000));
    return result == 0 ? status : result;
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
    const QCommandLineOption status(QStringLiteral("status"),
        QStringLiteral(
            "Show the daemon's state, and the accounts you may see (all for root; one given by name or uid). "
            "Exit status 0 online, 1 offline, 2 not running or switched off."));
    const QCommandLineOption json(QStringLiteral("json"), QStringLiteral("With --status: one JSON object."));
    const QCommandLineOption checkConfig(QStringLiteral("check-config"),
        QStringLiteral("Check the settings file (or FILE). Exit status 0 clean, 1 warnings, 2 errors."));
    parser.addOptions({ status, json, checkConfig });
    parser.addPositionalArgument(QStringLiteral("ACCOUNT|FILE"),
        QStringLiteral("The account for --status, the file for --check-config."), QStringLiteral("[ACCOUNT|FILE]"));
    parser.process(app);
    if (parser.isSet(checkConfig))
        return runCheckConfig(parser.positionalArguments());
    if (parser.isSet(status))
        return runStatus(app, parser.positionalArguments().value(0), parser.isSet(json));

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
