// kest-test-domain-server: a small domain server for the tests and the demonstration (see README.md).
#include "domainserver.h"

#include <QCommandLineParser>
#include <QCoreApplication>
#include <QHostAddress>
#include <QTextStream>

namespace
{
int fail(const QString &text)
{
    QTextStream(stderr) << "kest-test-domain-server: " << text << Qt::endl;
    return 1;
}
} // namespace

int main(int argc, char *argv[])
{
    QCoreApplication application(argc, argv);
    QCoreApplication::setApplicationName(QStringLiteral("kest-test-domain-server"));
    QCoreApplication::setApplicationVersion(QStringLiteral("1.0"));

    QCommandLineParser parser;
    parser.setApplicationDescription(QStringLiteral("Test domain server: REST over HTTPS with client certificates."));
    parser.addHelpOption();
    parser.addVersionOption();
    const QCommandLineOption address(QStringLiteral("address"), QStringLiteral("Loopback address to listen on."),
        QStringLiteral("ADDRESS"), QStringLiteral("127.0.0.2"));
    const QCommandLineOption port(QStringLiteral("port"), QStringLiteral("Port; 0 picks a free one."),
        QStringLiteral("PORT"), QStringLiteral("0"));
    const QCommandLineOption cert(
        QStringLiteral("cert"), QStringLiteral("Server certificate (PEM)."), QStringLiteral("FILE"));
    const QCommandLineOption key(
        QStringLiteral("key"), QStringLiteral("Server private key (PEM, RSA)."), QStringLiteral("FILE"));
    const QCommandLineOption ca(
        QStringLiteral("ca"), QStringLiteral("CA that must have signed client certificates."), QStringLiteral("FILE"));
    const QCommandLineOption plain(QStringLiteral("plain"), QStringLiteral("Speak plain HTTP instead of HTTPS."));
    const QCommandLineOption data(
        QStringLiteral("data"), QStringLiteral("JSON file of users and groups."), QStringLiteral("FILE"));
    const QCommandLineOption behaviour(QStringLiteral("behaviour"),
        QStringLiteral("JSON file mapping paths to misbehaviours, read per request."), QStringLiteral("FILE"));
    const QCommandLineOption log(
        QStringLiteral("log"), QStringLiteral("File that gets one JSON line per request."), QStringLiteral("FILE"));
    parser.addOptions({ address, port, cert, key, ca, plain, data, behaviour, log });
    parser.process(application);

    // Whatever is configured, this server is only ever reachable from the machine itself.
    const QHostAddress host(parser.value(address));
    if (!host.isLoopback())
        return fail(QStringLiteral("not a loopback address: ") + parser.value(address));
    bool portOk = false;
    const uint portNumber = parser.value(port).toUInt(&portOk);
    if (!portOk || portNumber > 65535)
        return fail(QStringLiteral("invalid port: ") + parser.value(port));
    if (!parser.isSet(data))
        return fail(QStringLiteral("--data is required"));

    DomainServer server(parser.value(data), parser.value(behaviour), parser.value(log));
    QString error;
    if (!server.isReadableData(error))
        return fail(error);
    if (!parser.isSet(plain) && !server.setTls(parser.value(cert), parser.value(key), parser.value(ca), error))
        return fail(error);
    if (!server.listen(host, static_cast<quint16>(portNumber)))
        return fail(QStringLiteral("cannot listen: ") + server.errorString());

    QTextStream(stdout) << "listening on " << host.toString() << ':' << server.serverPort() << Qt::endl;
    return application.exec();
}
