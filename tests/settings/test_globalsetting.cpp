#include "globalsetting.h"
#include "messagehandler.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QTest>

#include <functional>

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

    // Called directly: through qFatal, Qt itself would end the process after the handler.
    void messageHandlerLine()
    {
        QFETCH(int, type);
        QFETCH(QString, message);
        QFETCH(int, priority);
        QFETCH(QByteArray, logged);
        messageHandler(QtMsgType(type), QMessageLogContext(), message);
        QCOMPARE(SyslogCapture::lines().size(), 1);
        QCOMPARE(SyslogCapture::lines().first().priority, priority);
        const QByteArray line = SyslogCapture::lines().first().text;
        QVERIFY2(QRegExp(QStringLiteral("cpu time: \\d+, ") + QRegExp::escape(QString::fromUtf8(logged)))
                     .exactMatch(QString::fromUtf8(line)),
            line);
    }
};

QTEST_GUILESS_MAIN(GlobalSettingTest)
#include "test_globalsetting.moc"
