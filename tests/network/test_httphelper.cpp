#include "domainserverfixture.h"
#include "globalsetting.h"
#include "heldloglines.h"
#include "httphelper.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDateTime>
#include <QElapsedTimer>
#include <QFile>
#include <QTcpServer>
#include <QTest>

#include <functional>
#include <syslog.h>

namespace
{
struct Key {
    const char *group;
    const char *key;
    QVariant defaultValue;
    QByteArray written;
    QVariant readBack;
    const char *getter;
    std::function<QVariant()> read;
    const char *warning = nullptr; // logged once the key is set
};

#define GETTER(name) #name, [] { return QVariant(GlobalSetting::instance()->name()); }

const QList<Key> &keys()
{
    // The keys with something to get wrong: a spelling of the system's own, defaults of both kinds, a
    // non-number, the readings that log, the two "buffer-limit"s of different groups, and a name
    // resolved to its IPv4 address.
    static const QList<Key> list {
        { "main", "entryption", QStringLiteral("aes"), "sm4", QStringLiteral("sm4"), GETTER(entryption) },
        { "main", "port", 10080, "abc", 0, GETTER(port) },
        { "main", "network-timeout", 5, "2", 2, GETTER(networkTimeout) },
        { "passwd", "buffer-limit", 512, "1024", 1024, GETTER(passwdBufferLimit) },
        { "group", "buffer-limit", 5120, "4096", 4096, GETTER(groupBufferLimit) },
        { "main", "ip", QStringLiteral("127.0.0.1"), "localhost", QStringLiteral("127.0.0.1"), GETTER(serverAddress) },
        // Not a valid host name: fails without asking any resolver.
        { "main", "ip", QStringLiteral("127.0.0.1"), "no such host!", QStringLiteral("no such host!"),
            GETTER(serverAddress), "IP Lookup failed " },
        { "main", "debug", false, "true", true, GETTER(isDebug), "danger! current run in debug mode." },
        { "main", "enable", false, "true", true, GETTER(isEnabled) },
    };
    return list;
}

const QString refused = QStringLiteral(R"({"code": -1,"msg": "web server refuse login."})");
const QString unreachable = QStringLiteral(R"({"code": -2,"msg": "client cannot connect to server."})");
const QString unknownAccount = QStringLiteral(R"({"code": -3,"msg": "network account does not exist."})");

QString ok(const char *data)
{
    return QStringLiteral(R"({"code":0,"data":%1,"msg":"ok"})").arg(QLatin1String(data));
}
const QString domainReply = ok(R"({"domain":"kest.test"})");
const QString alice
    = ok(R"({"user":{"gecos":"Alice","home":"/home/alice","name":"%1","password":"x","permissions":)"
         R"(["sudo","lp"],"primary_group":{"id":10000,"name":"kest"},"shell":"/bin/bash","uid":10001}})");

// A call of the client, the request the server is to see ("METHOD PATH BODY") and the reply the call then gives.
struct Operation {
    const char *name;
    const char *request;
    QString reply;
    std::function<QString(HttpHelper &)> call;
};

// The requests of the client.
const QList<Operation> &everyOperation()
{
    static const QList<Operation> list {
        { "queryUserByName", R"(GET /v3/account/ {"username":"alice","domain":"kest.test"})",
            alice.arg(QLatin1String("@alice")),
            [](HttpHelper &h) { return h.queryUserByName(QStringLiteral("@alice")); } },
        { "queryUserByUid", R"(GET /v3/account/ {"uid":10001})", alice.arg(QLatin1String("alice")),
            [](HttpHelper &h) { return h.queryUserByUid(10001); } },
        { "authenticate",
            R"(POST /v1/auth/ {"data":{"username":"@alice","password":"a\"b\\c","machine_id":"machine-1"},"method":"otp"})",
            ok(R"({"result":false})"),
            [](HttpHelper &h) {
                return h.authenticate(QStringLiteral("@alice"), QStringLiteral("a\"b\\c"), QStringLiteral("otp"));
            } },
        { "queryGroupByName", R"(GET /v3/group/ {"groupname":"staff"})",
            ok(R"({"group":{"gid":10010,"members":["alice"],"name":"staff"}})"),
            [](HttpHelper &h) { return h.queryGroupByName(QStringLiteral("staff")); } },
        { "queryGroupByGid", R"(GET /v3/group/ {"gid":10000})",
            ok(R"({"group":{"gid":10000,"members":["alice","bob"],"name":"kest"}})"),
            [](HttpHelper &h) { return h.queryGroupByGid(10000); } },
        { "resetPassword",
            R"(PATCH /v3/client/reset_password {"uid":10001,"username":"@alice","password":"new","old_password":"alice-password"})",
            ok("null"),
            [](HttpHelper &h) {
                return h.resetPassword(
                    10001, QStringLiteral("@alice"), QStringLiteral("new"), QStringLiteral("alice-password"));
            } },
        { "queryDomain", "GET /v1/domain/ ", domainReply, [](HttpHelper &h) { return h.queryDomain(); } },
    };
    return list;
}

// The warnings logged so far, one a line, after "cpu time: N, ".
QString logged()
{
    QStringList lines;
    for (const SyslogLine &line : SyslogCapture::lines())
        if (line.priority == LOG_WARNING)
            lines << QString::fromUtf8(line.text.mid(line.text.indexOf(", ") + 2));
    return lines.join(QLatin1Char('\n'));
}

} // namespace

// The settings as every program reads them, the log handler, and the domain server client against the test
// domain server over real TLS.
class HttpHelperTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        qInstallMessageHandler(messageHandler);
        QVERIFY2(m_server.isValid() && m_server.start(), qPrintable(m_server.errorText()));
        QVERIFY(m_root.writeFile(QStringLiteral("/usr/share/kest/machine.txt"), "machine-1\nsecond\n")
            && DomainServerFixture::makeCertificates(m_other.path()));
    }

    void init()
    {
        QVERIFY(serve(QStringLiteral("server")) && m_server.clearMisbehaviour() && m_server.clearRequests());
        SyslogCapture::clear();
    }

    void getters_data()
    {
        QTest::addColumn<int>("index");
        QTest::addColumn<QByteArray>("ini"); // null: no settings file
        QTest::addColumn<bool>("written");
        for (int i = 0; i < keys().size(); ++i) {
            const Key &key = keys().at(i);
            QTest::addRow("%s %s absent", key.getter, key.written.constData()) << i << QByteArray() << false;
            // The same key in another group must not be taken ("buffer-limit" of passwd and group, say).
            const QByteArray otherGroup = qstrcmp(key.group, "group") == 0 ? "passwd" : "group";
            QTest::addRow("%s %s elsewhere", key.getter, key.written.constData())
                << i << "[" + otherGroup + "]\n" + key.key + "=" + key.written + "\n[main]\nencryption=x\n"
                << false;
            QTest::addRow("%s %s set", key.getter, key.written.constData())
                << i << "[" + QByteArray(key.group) + "]\n" + key.key + "=" + key.written + "\n"
                << true;
        }
    }

    void getters()
    {
        QFETCH(int, index);
        QFETCH(QByteArray, ini);
        QFETCH(bool, written);
        TestRoot root;
        if (!ini.isNull())
            QVERIFY(root.writeSettings(ini));
        const Key &key = keys().at(index);
        QCOMPARE(key.read(), written ? key.readBack : key.defaultValue);
        QCOMPARE(SyslogCapture::lines().size(), written && key.warning ? 1 : 0);
        if (written && key.warning)
            QCOMPARE(SyslogCapture::count(key.warning), 1);
    }

    // Same size, same second: the edit must still be seen.
    void editsApplyAtTheNextCall()
    {
        TestRoot root;
        for (const int port : { 1000, 2000 }) {
            QVERIFY(root.writeSettings("[main]\nport=" + QByteArray::number(port) + "\n"));
            QCOMPARE(GlobalSetting::instance()->port(), port);
        }
    }

    // The handler every program installs, through which the warnings above reach syslog.
    void messageHandlerLine_data()
    {
        QTest::addColumn<int>("type");
        QTest::addColumn<QString>("message");
        QTest::addColumn<int>("priority");
        QTest::addColumn<QByteArray>("logged");
        QTest::newRow("debug") << int(QtDebugMsg) << QStringLiteral("plain") << 7 << QByteArray("plain");
        QTest::newRow("info") << int(QtInfoMsg) << QStringLiteral("first\nsecond") << 6 << QByteArray("first. second");
        QTest::newRow("warning") << int(QtWarningMsg) << QStringLiteral("a\r\nb") << 4 << QByteArray("a. . b");
        QTest::newRow("critical is 2") << int(QtCriticalMsg) << QStringLiteral("say \\\"hi\\\"") << 2
                                       << QByteArray("say hi");
        QTest::newRow("fatal is 3") << int(QtFatalMsg) << QStringLiteral("one\\ntwo") << 3 << QByteArray("one two");
        QTest::newRow("other is notice") << 42 << QStringLiteral("100% %s %n") << 5 << QByteArray("100% %s %n");
    }

    // Called directly: through qFatal, Qt itself would end the process after the handler. Each line comes after
    // one that was held back with it; only a fatal one does not wait for the end of the hold.
    void messageHandlerLine()
    {
        QFETCH(int, type);
        QFETCH(QString, message);
        QFETCH(int, priority);
        QFETCH(QByteArray, logged);
        {
            const HeldLogLines held;
            messageHandler(QtInfoMsg, QMessageLogContext(), QStringLiteral("held"));
            messageHandler(QtMsgType(type), QMessageLogContext(), message);
            QCOMPARE(SyslogCapture::lines().size(), type == QtFatalMsg ? 2 : 0);
        }
        QCOMPARE(SyslogCapture::lines().size(), 2);
        QVERIFY(SyslogCapture::lines().first().text.endsWith(", held"));
        QCOMPARE(SyslogCapture::lines().last().priority, priority);
        const QByteArray line = SyslogCapture::lines().last().text;
        QVERIFY2(QRegExp(QStringLiteral("cpu time: \\d+, ") + QRegExp::escape(QString::fromUtf8(logged)))
                     .exactMatch(QString::fromUtf8(line)),
            line);
    }

    // settings: lines "group/key=value", or "group/key" to leave the key out. behaviour: the server's
    // misbehaviour on the operation's path, "server:CERTIFICATE [LISTEN]" for another face of the server
    // ("plain": HTTP), or "no settings".
    void exchange_data()
    {
        QTest::addColumn<int>("op");
        QTest::addColumn<QString>("settings");
        QTest::addColumn<QString>("behaviour");
        QTest::addColumn<QString>("expected");
        QTest::addColumn<int>("sent");
        const auto row = [](const char *name, int op, const QString &settings, const char *behaviour,
                             const QString &expected, int sent) {
            QTest::newRow(name) << op << settings << QString::fromLatin1(behaviour) << expected << sent;
        };
        for (int i = 0; i < everyOperation().size(); ++i)
            row(everyOperation().at(i).name, i, {}, "", everyOperation().at(i).reply, 1);
        // Every request reads its reply the same way: the user look-up through its own path, the others through
        // the common one.
        row("no msg", 0, {}, "no-msg", refused, 1);
        row("not JSON", 2, {}, "not-json", refused, 1);
        row("404 with a JSON body", 0, {}, "status:404", alice.arg(QLatin1String("@alice")), 1);
        // Then the empty body is taken apart like any other.
        row("closed without an answer: sent once", 0, {}, "close", refused, 1);
        row("redirect not followed", 0, {}, "redirect:/v1/domain/",
            QStringLiteral(R"({"code":302,"data":null,"msg":"moved"})"), 1);
        row("reply after the time-out", 0, QStringLiteral("main/network-timeout=1"), "delay:2000", refused, 1);
        row("without settings file nothing is sent", 6, {}, "no settings", unreachable, 0);

        const QString missing = m_other.filePath(QStringLiteral("missing.pem"));
        row("CA file missing, literal address: nothing sent", 6, QStringLiteral("url/server-cert=") + missing, "",
            unreachable, 0);
        row("server of another CA", 6, QStringLiteral("url/server-cert=") + m_other.filePath(QStringLiteral("ca.pem")),
            "", unreachable, 0);
        row("self-signed server", 6, {}, "server:selfsigned", unreachable, 0);
        row("expired server certificate", 6, {}, "server:expired", unreachable, 0);
        row("no subjectAltName, literal address: taken", 6, {}, "server:nosan", domainReply, 1);
        row("IPv6 literal", 6, QStringLiteral("main/ip=::1"), "server:server ::1", domainReply, 1);
        row("host name", 6, QStringLiteral("main/ip=localhost"), "server:server 127.0.0.1", domainReply, 1);
        row("host name the certificate lacks", 6, QStringLiteral("main/ip=localhost"), "server:nosan 127.0.0.1",
            unreachable, 0);
        // A client that cannot show its own certificate would only be refused: it counts as an outage instead.
        row("neither client certificate nor key", 6, QStringLiteral("url/public-key\nurl/private-key=") + missing, "",
            unreachable, 0);
        row("client key missing", 6, QStringLiteral("url/private-key=") + missing, "", unreachable, 0);
        row("client key of another certificate", 6,
            QStringLiteral("url/private-key=") + m_other.filePath(QStringLiteral("client.key")), "", unreachable, 0);
        row("client certificate file holds a key", 6,
            QStringLiteral("url/public-key=") + m_server.filePath(QStringLiteral("client.key")), "", unreachable, 0);
        row("plain HTTP", 0, QStringLiteral("url/protocol=http://\nurl/server-cert\nurl/public-key\nurl/private-key"),
            "server:plain", alice.arg(QLatin1String("@alice")), 1);
    }

    void exchange()
    {
        QFETCH(int, op);
        QFETCH(QString, settings);
        QFETCH(QString, behaviour);
        QFETCH(int, sent);
        const Operation &operation = everyOperation().at(op);
        QVERIFY(writeSettings(settings));
        if (behaviour.startsWith(QLatin1String("server:")))
            QVERIFY2(serve(behaviour.mid(7)), qPrintable(m_server.errorText()));
        else if (behaviour == QLatin1String("no settings"))
            QVERIFY(m_root.removeSettings());
        else
            QVERIFY(m_server.setMisbehaviour(
                QString::fromLatin1(operation.request).section(QLatin1Char(' '), 1, 1), behaviour));
        HttpHelper helper;
        QTEST(operation.call(helper), "expected");
        const QList<QJsonObject> requests = m_server.requests();
        QCOMPARE(requests.size(), sent);
        // Whatever goes wrong, the password never reaches the log.
        QVERIFY2(!logged().contains(QLatin1String("a\"b")), qPrintable(logged()));
        if (!sent)
            return;
        // What the server saw: the request, the client's name in its certificate and the headers.
        const QJsonObject headers = requests.first().value(QLatin1String("headers")).toObject();
        QString seen;
        for (const char *key : { "method", "path", "body", "client" })
            seen += requests.first().value(QLatin1String(key)).toString() + QLatin1Char(' ');
        for (const char *key : { "content-type", "accept", "user-agent" })
            seen += headers.value(QLatin1String(key)).toString() + QLatin1Char(' ');
        QCOMPARE(seen,
            QLatin1String(operation.request)
                + QLatin1String(m_mode == QLatin1String("plain") ? "  " : " kest-test-client ")
                + QLatin1String("application/json application/json KEST "));
    }

    // Requests share one connection until the TLS files change. One failed connection starts an outage:
    // later calls answer at once, without a word or a packet, until a probe reaches the server again.
    void connectionsAndOutage()
    {
        QVERIFY(writeSettings());
        HttpHelper helper;
        for (int i = 0; i < 3; ++i)
            QCOMPARE(helper.queryDomain(), domainReply);
        QFile key(m_server.filePath(QStringLiteral("client.key")));
        QVERIFY(key.open(QIODevice::Append)
            && key.setFileTime(QDateTime::currentDateTime().addSecs(1), QFileDevice::FileModificationTime));
        QCOMPARE(helper.queryDomain(), domainReply);
        QList<int> ids;
        for (const QJsonObject &request : m_server.requests())
            ids << request.value(QLatin1String("connection")).toInt();
        QCOMPARE(ids, (QList<int> { ids.value(0), ids.value(0), ids.value(0), ids.value(3) }));
        QVERIFY(ids.value(3) != ids.value(0));

        QTcpServer probe; // a port of the server's address on which nothing listens
        QVERIFY(probe.listen(QHostAddress(DomainServerFixture::address())));
        const quint16 closed = probe.serverPort();
        probe.close();
        QVERIFY(writeSettings(QStringLiteral("main/port=%1").arg(closed)) && m_server.clearRequests());
        for (int i = 0; i < 3; ++i)
            QCOMPARE(helper.queryDomain(), unreachable);
        // Names without the local "@" are never asked for: no word of the outage either.
        for (const QString &name : { QStringLiteral("alice"), QStringLiteral("\uFF20alice") })
            QCOMPARE(helper.queryUserByName(name), unknownAccount);
        QCOMPARE(
            logged(), QStringLiteral("error host address: 127.0.0.2:%1, error detail: Connection refused").arg(closed));
        QVERIFY(writeSettings());
        QCOMPARE(helper.queryDomain(), unreachable);
        QVERIFY(m_server.requests().isEmpty());
        QString hostPort;
        QVERIFY(helper.checkServerAddress(hostPort));
        QCOMPARE(helper.queryDomain(), domainReply);
    }

    // A missing client key is told once for the outage, naming the file, and the probe keeps the outage until the
    // key is back; no call waits on the network meanwhile.
    void clientKeyOutageToldOnce()
    {
        const QString missing = m_other.filePath(QStringLiteral("missing.key"));
        QVERIFY(writeSettings(QStringLiteral("url/private-key=") + missing));
        HttpHelper helper;
        QString hostPort;
        QElapsedTimer timer;
        timer.start();
        for (int i = 0; i < 5; ++i)
            QCOMPARE(helper.queryDomain(), unreachable);
        QVERIFY(!helper.checkServerAddress(hostPort));
        QVERIFY2(timer.elapsed() < 1000, qPrintable(QString::number(timer.elapsed())));
        QCOMPARE(SyslogCapture::count("error host address: "), 1);
        QCOMPARE(SyslogCapture::count("error detail: client private key file missing: " + missing.toUtf8()), 1);
        QVERIFY(m_server.requests().isEmpty());
        QVERIFY(writeSettings());
        QVERIFY(helper.checkServerAddress(hostPort));
        QCOMPARE(helper.queryDomain(), domainReply);
    }

private:
    // Restarts the server when it is to show another certificate, speak plain HTTP or listen elsewhere.
    bool serve(const QString &mode)
    {
        if (mode == m_mode)
            return true;
        m_mode = mode;
        const QString certificate = mode.section(QLatin1Char(' '), 0, 0);
        const QString listen = mode.section(QLatin1Char(' '), 1);
        m_server.setListenAddress(listen.isEmpty() ? DomainServerFixture::address() : listen);
        const bool plain = certificate == QLatin1String("plain");
        return m_server.start(m_server.port(), plain, plain ? QStringLiteral("server") : certificate);
    }

    // Settings for the server, with the overrides of a row (see exchange_data).
    bool writeSettings(const QString &overrides = QString())
    {
        QVariantMap values { { QStringLiteral("main/domain"), QStringLiteral("kest.test") } };
        for (const QString &line : overrides.split(QLatin1Char('\n'), Qt::SkipEmptyParts))
            values.insert(line.section(QLatin1Char('='), 0, 0),
                line.contains(QLatin1Char('=')) ? QVariant(line.section(QLatin1Char('='), 1)) : QVariant());
        return m_root.writeSettings(m_server.settingsIni(values));
    }

    TestRoot m_root;
    DomainServerFixture m_server;
    QTemporaryDir m_other;
    QString m_mode = QStringLiteral("server");
};

QTEST_GUILESS_MAIN(HttpHelperTest)
#include "test_httphelper.moc"
