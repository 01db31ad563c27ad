#include "globalsetting.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <functional>

namespace {
using Getter = std::function<QVariant(const GlobalSetting *)>;

Getter getter(const QString &name)
{
    static const QHash<QString, Getter> getters {
        { QStringLiteral("ip"), [](const GlobalSetting *s) { return QVariant(s->ip()); } },
        { QStringLiteral("entryption"), [](const GlobalSetting *s) { return QVariant(s->entryption()); } },
        { QStringLiteral("domain"), [](const GlobalSetting *s) { return QVariant(s->domain()); } },
        { QStringLiteral("homeRoot"), [](const GlobalSetting *s) { return QVariant(s->homeRoot()); } },
        { QStringLiteral("protocol"), [](const GlobalSetting *s) { return QVariant(s->protocol()); } },
        { QStringLiteral("userUrl"), [](const GlobalSetting *s) { return QVariant(s->userUrl()); } },
        { QStringLiteral("resetPasswordUrl"), [](const GlobalSetting *s) { return QVariant(s->resetPasswordUrl()); } },
        { QStringLiteral("groupUrl"), [](const GlobalSetting *s) { return QVariant(s->groupUrl()); } },
        { QStringLiteral("authUrl"), [](const GlobalSetting *s) { return QVariant(s->authUrl()); } },
        { QStringLiteral("domainUrl"), [](const GlobalSetting *s) { return QVariant(s->domainUrl()); } },
        { QStringLiteral("port"), [](const GlobalSetting *s) { return QVariant(s->port()); } },
        { QStringLiteral("networkTimeout"), [](const GlobalSetting *s) { return QVariant(s->networkTimeout()); } },
        { QStringLiteral("networkFrequency"), [](const GlobalSetting *s) { return QVariant(s->networkFrequency()); } },
        { QStringLiteral("dbusTimeout"), [](const GlobalSetting *s) { return QVariant(s->dbusTimeout()); } },
        { QStringLiteral("passwdLengthLimit"), [](const GlobalSetting *s) { return QVariant(s->passwdLengthLimit()); } },
        { QStringLiteral("passwdBufferLimit"), [](const GlobalSetting *s) { return QVariant(s->passwdBufferLimit()); } },
        { QStringLiteral("groupLengthLimit"), [](const GlobalSetting *s) { return QVariant(s->groupLengthLimit()); } },
        { QStringLiteral("groupMemberCountLimit"),
          [](const GlobalSetting *s) { return QVariant(s->groupMemberCountLimit()); } },
        { QStringLiteral("groupBufferLimit"), [](const GlobalSetting *s) { return QVariant(s->groupBufferLimit()); } },
        { QStringLiteral("isDebug"), [](const GlobalSetting *s) { return QVariant(s->isDebug()); } },
        { QStringLiteral("isEnabled"), [](const GlobalSetting *s) { return QVariant(s->isEnabled()); } },
        { QStringLiteral("serverCert"), [](const GlobalSetting *s) { return QVariant(s->serverCert()); } },
        { QStringLiteral("privateKey"), [](const GlobalSetting *s) { return QVariant(s->privateKey()); } },
        { QStringLiteral("publicKey"), [](const GlobalSetting *s) { return QVariant(s->publicKey()); } },
    };
    return getters.value(name);
}
} // namespace

class GlobalSettingTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init() { SyslogCapture::clear(); }

    void getters_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<QByteArray>("ini"); // settings file content; null: no file at all
        QTest::addColumn<QVariant>("expected");

        const struct {
            const char *name;
            const char *group;
            const char *key;
            QVariant defaultValue;
            const char *written;
            QVariant readBack;
        } keys[] = {
            { "ip", "main", "ip", QStringLiteral("127.0.0.1"), "10.1.2.3", QStringLiteral("10.1.2.3") },
            { "entryption", "main", "entryption", QStringLiteral("aes"), "sm4", QStringLiteral("sm4") },
            { "domain", "main", "domain", QStringLiteral("@"), "corp", QStringLiteral("corp") },
            { "homeRoot", "main", "home", QStringLiteral("/home/remote"), "/srv/home", QStringLiteral("/srv/home") },
            { "protocol", "url", "protocol", QStringLiteral("https://"), "http://", QStringLiteral("http://") },
            { "userUrl", "url", "user", QStringLiteral("/v3/account/"), "/u/", QStringLiteral("/u/") },
            { "resetPasswordUrl", "url", "reset_password", QStringLiteral("/v3/client/reset_password"), "/r",
              QStringLiteral("/r") },
            { "groupUrl", "url", "group", QStringLiteral("/v3/group/"), "/g/", QStringLiteral("/g/") },
            { "authUrl", "url", "auth", QStringLiteral("/v1/auth/"), "/a/", QStringLiteral("/a/") },
            { "domainUrl", "url", "domain", QStringLiteral("/v1/domain/"), "/d/", QStringLiteral("/d/") },
            { "port", "main", "port", 10080, "8443", 8443 },
            { "networkTimeout", "main", "network-timeout", 5, "2", 2 },
            { "networkFrequency", "main", "network-frequency", 100, "7", 7 },
            { "dbusTimeout", "main", "dbus-timeout", 5, "9", 9 },
            { "passwdLengthLimit", "passwd", "length-limit", 64, "32", 32 },
            { "passwdBufferLimit", "passwd", "buffer-limit", 512, "1024", 1024 },
            { "groupLengthLimit", "group", "length-limit", 64, "16", 16 },
            { "groupMemberCountLimit", "group", "member-count-limit", 64, "8", 8 },
            { "groupBufferLimit", "group", "buffer-limit", 5120, "4096", 4096 },
            { "isDebug", "main", "debug", false, "true", true },
            { "isEnabled", "main", "enable", false, "true", true },
        };
        for (const auto &key : keys) {
            QTest::addRow("%s no file", key.name) << QString::fromLatin1(key.name) << QByteArray() << key.defaultValue;
            QTest::addRow("%s other keys only", key.name)
                << QString::fromLatin1(key.name) << QByteArray("[main]\nunrelated=1\n[misc]\nport=1\n")
                << key.defaultValue;
            QTest::addRow("%s set", key.name)
                << QString::fromLatin1(key.name)
                << QByteArray("[") + key.group + "]\n" + key.key + "=" + key.written + "\n" << key.readBack;
        }
        QTest::newRow("correct spelling encryption is ignored")
            << QStringLiteral("entryption") << QByteArray("[main]\nencryption=sm4\n") << QVariant(QStringLiteral("aes"));
        QTest::newRow("port not a number") << QStringLiteral("port") << QByteArray("[main]\nport=abc\n") << QVariant(0);
        QTest::newRow("passwd buffer-limit is not the group one")
            << QStringLiteral("passwdBufferLimit") << QByteArray("[group]\nbuffer-limit=77\n") << QVariant(512);
        QTest::newRow("group buffer-limit is not the passwd one")
            << QStringLiteral("groupBufferLimit") << QByteArray("[passwd]\nbuffer-limit=77\n") << QVariant(5120);
    }

    void getters()
    {
        QFETCH(QString, name);
        QFETCH(QByteArray, ini);
        QFETCH(QVariant, expected);

        TestRoot root;
        QVERIFY(root.isValid());
        if (!ini.isNull())
            QVERIFY(root.writeSettings(ini));
        const Getter read = getter(name);
        QVERIFY(read);
        QCOMPARE(read(GlobalSetting::instance()), expected);
        QCOMPARE(SyslogCapture::count("danger! current run in debug mode."),
                 name == QLatin1String("isDebug") && expected.toBool() ? 1 : 0);
    }

    void editsApplyAtTheNextCall()
    {
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nport=1000\n"));
        QCOMPARE(GlobalSetting::instance()->port(), 1000);
        QVERIFY(root.writeSettings("[main]\nport=2000000\n"));
        QCOMPARE(GlobalSetting::instance()->port(), 2000000);
        QVERIFY(root.removeSettings());
        QCOMPARE(GlobalSetting::instance()->port(), 10080);
    }

    void certificatePaths_data()
    {
        QTest::addColumn<QString>("name");
        QTest::addColumn<QByteArray>("key");
        QTest::addColumn<QByteArray>("warning");
        QTest::newRow("server") << QStringLiteral("serverCert") << QByteArray("server-cert")
                                << QByteArray("server cert file is not exists. config: ");
        QTest::newRow("private") << QStringLiteral("privateKey") << QByteArray("private-key")
                                 << QByteArray("client private key file is not exists. config: ");
        QTest::newRow("public") << QStringLiteral("publicKey") << QByteArray("public-key")
                                << QByteArray("client public key file is not exists. config: ");
    }

    void certificatePaths()
    {
        QFETCH(QString, name);
        QFETCH(QByteArray, key);
        QFETCH(QByteArray, warning);
        TestRoot root;
        const Getter read = getter(name);

        // Absent key: the empty value is reported too.
        QCOMPARE(read(GlobalSetting::instance()).toString(), QString());
        QCOMPARE(SyslogCapture::count(warning), 1);
        QVERIFY(SyslogCapture::lines().first().text.endsWith(warning));

        SyslogCapture::clear();
        const QString missing = root.filePath(QStringLiteral("/etc/missing.pem"));
        QVERIFY(root.writeSettings("[url]\n" + key + "=" + missing.toUtf8() + "\n"));
        QCOMPARE(read(GlobalSetting::instance()).toString(), missing);
        QCOMPARE(SyslogCapture::count(warning + missing.toUtf8()), 1);
        QCOMPARE(SyslogCapture::lines().first().priority, 4);

        SyslogCapture::clear();
        QVERIFY(root.writeFile(QStringLiteral("/etc/present.pem"), "pem"));
        const QString present = root.filePath(QStringLiteral("/etc/present.pem"));
        QVERIFY(root.writeSettings("[url]\n" + key + "=" + present.toUtf8() + "\n"));
        QCOMPARE(read(GlobalSetting::instance()).toString(), present);
        QVERIFY(SyslogCapture::lines().isEmpty());
    }

    void serverAddress_data()
    {
        QTest::addColumn<QByteArray>("ip");
        QTest::addColumn<QString>("expected");
        QTest::addColumn<int>("lookupWarnings");

        QTest::newRow("default") << QByteArray() << QStringLiteral("127.0.0.1") << 0;
        QTest::newRow("literal IPv4") << QByteArray("192.0.2.7") << QStringLiteral("192.0.2.7") << 0;
        QTest::newRow("literal IPv6 unchanged") << QByteArray("::1") << QStringLiteral("::1") << 0;
        QTest::newRow("name resolves to IPv4") << QByteArray("localhost") << QStringLiteral("127.0.0.1") << 0;
        // Not a valid host name at all: fails without asking any resolver.
        QTest::newRow("unresolvable name") << QByteArray("no such host!") << QStringLiteral("no such host!") << 1;
    }

    void serverAddress()
    {
        QFETCH(QByteArray, ip);
        QFETCH(QString, expected);
        QFETCH(int, lookupWarnings);
        TestRoot root;
        if (!ip.isNull())
            QVERIFY(root.writeSettings("[main]\nip=\"" + ip + "\"\n"));
        QCOMPARE(GlobalSetting::instance()->serverAddress(), expected);
        QCOMPARE(GlobalSetting::instance()->ip(), ip.isNull() ? QStringLiteral("127.0.0.1") : QString::fromUtf8(ip));
        QCOMPARE(SyslogCapture::count("IP Lookup failed "), lookupWarnings);
    }
};

QTEST_GUILESS_MAIN(GlobalSettingTest)
#include "test_globalsetting.moc"
