#include "globalsetting.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <functional>

namespace
{
const GlobalSetting *settings()
{
    return GlobalSetting::instance();
}

struct Key {
    const char *group;
    const char *key;
    QVariant defaultValue;
    QByteArray written;
    QVariant readBack;
    std::function<QVariant()> read;
};

#define GETTER(name) [] { return QVariant(settings()->name()); }

const QList<Key> &keys()
{
    // The keys with something to get wrong: a spelling of the system's own, defaults of both kinds, a
    // non-number, the one key whose reading logs, and the two "buffer-limit"s of different groups.
    static const QList<Key> list {
        { "main", "ip", QStringLiteral("127.0.0.1"), "10.1.2.3", QStringLiteral("10.1.2.3"), GETTER(ip) },
        { "main", "entryption", QStringLiteral("aes"), "sm4", QStringLiteral("sm4"), GETTER(entryption) },
        { "url", "protocol", QStringLiteral("https://"), "http://", QStringLiteral("http://"), GETTER(protocol) },
        { "main", "port", 10080, "abc", 0, GETTER(port) },
        { "main", "network-timeout", 5, "2", 2, GETTER(networkTimeout) },
        { "passwd", "buffer-limit", 512, "1024", 1024, GETTER(passwdBufferLimit) },
        { "group", "buffer-limit", 5120, "4096", 4096, GETTER(groupBufferLimit) },
        { "main", "debug", false, "true", true, GETTER(isDebug) },
        { "main", "enable", false, "true", true, GETTER(isEnabled) },
    };
    return list;
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
        QTest::addColumn<int>("index");
        QTest::addColumn<QByteArray>("ini"); // null: no settings file
        QTest::addColumn<bool>("written");
        for (int i = 0; i < keys().size(); ++i) {
            const Key &key = keys().at(i);
            QTest::addRow("%s/%s absent", key.group, key.key) << i << QByteArray() << false;
            // The same key in another group must not be taken ("buffer-limit" of passwd and group, say).
            const QByteArray otherGroup = qstrcmp(key.group, "group") == 0 ? "passwd" : "group";
            QTest::addRow("%s/%s elsewhere", key.group, key.key)
                << i << "[" + otherGroup + "]\n" + key.key + "=" + key.written + "\n[main]\nencryption=x\n"
                << false;
            QTest::addRow("%s/%s set", key.group, key.key)
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
        QCOMPARE(SyslogCapture::count("danger! current run in debug mode."),
            qstrcmp(key.key, "debug") == 0 && written ? 1 : 0);
    }

    void certificatePaths()
    {
        TestRoot root;
        QVERIFY(root.writeFile(QStringLiteral("/etc/present.pem"), "pem"));
        const QByteArray present = root.filePath(QStringLiteral("/etc/present.pem")).toUtf8();
        QVERIFY(root.writeSettings("[url]\nserver-cert=" + present + "\nprivate-key=/nonexistent.pem\n"));
        QCOMPARE(settings()->serverCert(), QString::fromUtf8(present));
        QCOMPARE(settings()->privateKey(), QStringLiteral("/nonexistent.pem"));
        QCOMPARE(settings()->publicKey(), QString());
        QVERIFY(SyslogCapture::count("server cert file is not exists.") == 0);
        QCOMPARE(SyslogCapture::count("client private key file is not exists. config: /nonexistent.pem"), 1);
        QCOMPARE(SyslogCapture::lines().last().priority, 4);
        QVERIFY(SyslogCapture::lines().last().text.endsWith("client public key file is not exists. config: "));
    }

    void serverAddress_data()
    {
        QTest::addColumn<QByteArray>("ip");
        QTest::addColumn<QString>("expected");
        QTest::addColumn<int>("lookupWarnings");
        QTest::newRow("literal IPv4") << QByteArray("192.0.2.7") << QStringLiteral("192.0.2.7") << 0;
        QTest::newRow("literal IPv6") << QByteArray("::1") << QStringLiteral("::1") << 0;
        QTest::newRow("name resolves to IPv4") << QByteArray("localhost") << QStringLiteral("127.0.0.1") << 0;
        // Not a valid host name: fails without asking any resolver.
        QTest::newRow("unresolvable") << QByteArray("no such host!") << QStringLiteral("no such host!") << 1;
    }

    void serverAddress()
    {
        QFETCH(QByteArray, ip);
        QFETCH(QString, expected);
        QFETCH(int, lookupWarnings);
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nip=\"" + ip + "\"\n"));
        QCOMPARE(settings()->serverAddress(), expected);
        QCOMPARE(SyslogCapture::count("IP Lookup failed "), lookupWarnings);
    }

    void editsApplyAtTheNextCall()
    {
        TestRoot root;
        QVERIFY(root.writeSettings("[main]\nport=1000\n"));
        QCOMPARE(settings()->port(), 1000);
        QVERIFY(root.writeSettings("[main]\nport=2000\n"));
        QCOMPARE(settings()->port(), 2000);
    }
};

QTEST_GUILESS_MAIN(GlobalSettingTest)
#include "test_globalsetting.moc"
