#include "cachetestsupport.h"
#include "messagehandler.h"
#include "offlinelogin.h"
#include "testroot.h"

#include <QTest>

namespace
{
const QString kExpired = QStringLiteral("[checkCacheEffectiveSeconds]: false");
const QString kDisabled = QStringLiteral("[offline_login_enable]: false");
const QString kNotFound = QStringLiteral("[checkOfflineLogin]: Cache file not found");
const QString kMarked = QStringLiteral("[removeStatus]: The cache file is marked for deletion: ");

QByteArray settings(const char *enable, const char *validity)
{
    QByteArray ini("[offline_login]\n");
    if (enable)
        ini += QByteArray("enable=") + enable + "\n";
    if (validity)
        ini += QByteArray("cache_validity=") + validity + "\n";
    return ini;
}
} // namespace

class OfflineLoginTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }

    void checkOfflineLogin_data()
    {
        QTest::addColumn<QByteArray>("ini"); // null: no settings file
        QTest::addColumn<QString>("account");
        QTest::addColumn<quint32>("removeStatus");
        QTest::addColumn<qint64>("age"); // seconds from the last login to now
        QTest::addColumn<bool>("expected");
        QTest::addColumn<QString>("warning"); // empty: none

        const QByteArray week = settings("true", "7");
        const QString alice = QStringLiteral("@alice");
        const qint64 day = 86400;
        QTest::newRow("exactly seven days") << week << alice << 0u << 7 * day << true << QString();
        QTest::newRow("seven days and a second") << week << alice << 0u << 7 * day + 1 << false << kExpired;
        QTest::newRow("an hour") << week << alice << 0u << qint64(3600) << true << QString();
        QTest::newRow("other account's record only")
            << week << QStringLiteral("@carol") << 0u << qint64(0) << false << kNotFound;
        QTest::newRow("account differs in case")
            << week << QStringLiteral("@Alice") << 0u << qint64(0) << false << kNotFound;
        QTest::newRow("marked for deletion") << week << alice << 1u << qint64(0) << false << kMarked + QLatin1Char('1');
        QTest::newRow("marked, expired and disabled")
            << settings("false", "7") << alice << 1u << 8 * day << false << kMarked + QLatin1Char('1');
        QTest::newRow("marked with another number")
            << week << alice << 4000000000u << qint64(0) << false << kMarked + QStringLiteral("4000000000");
        QTest::newRow("expired and disabled") << settings("false", "7") << alice << 0u << 8 * day << false << kExpired;
        QTest::newRow("disabled") << settings("false", "7") << alice << 0u << qint64(0) << false << kDisabled;
        QTest::newRow("enable absent") << settings(nullptr, "7") << alice << 0u << qint64(0) << false << kDisabled;
        QTest::newRow("no settings file, same second")
            << QByteArray() << alice << 0u << qint64(0) << false << kDisabled;
        QTest::newRow("no settings file, a second ago")
            << QByteArray() << alice << 0u << qint64(1) << false << kExpired;
        QTest::newRow("validity absent, same second")
            << settings("true", nullptr) << alice << 0u << qint64(0) << true << QString();
        QTest::newRow("validity absent, a second ago")
            << settings("true", nullptr) << alice << 0u << qint64(1) << false << kExpired;
        QTest::newRow("validity zero, login in the future")
            << settings("true", "0") << alice << 0u << qint64(-3600) << true << QString();
        QTest::newRow("validity not a number")
            << settings("true", "abc") << alice << 0u << qint64(1) << false << kExpired;
        QTest::newRow("49710 days, 1000 days ago")
            << settings("true", "49710") << alice << 0u << 1000 * day << true << QString();
        QTest::newRow("49711 days wrap, 1000 days ago")
            << settings("true", "49711") << alice << 0u << 1000 * day << false << kExpired;
        QTest::newRow("49711 days wrap to 63104 s, at the edge")
            << settings("true", "49711") << alice << 0u << qint64(63104) << true << QString();
        QTest::newRow("49711 days wrap to 63104 s, past it")
            << settings("true", "49711") << alice << 0u << qint64(63105) << false << kExpired;
    }

    void checkOfflineLogin()
    {
        QFETCH(QByteArray, ini);
        QFETCH(QString, account);
        QFETCH(quint32, removeStatus);
        QFETCH(qint64, age);
        QFETCH(bool, expected);
        QFETCH(QString, warning);

        TestRoot root;
        QVERIFY(root.isValid());
        if (!ini.isNull())
            QVERIFY(root.writeSettings(ini));
        // A fresh, unmarked record of someone else must not stand in for the account.
        RecordFields bob;
        bob.uid = 20002;
        bob.account = "@bob";
        bob.lastLoginTime = quint64(QDateTime::currentSecsSinceEpoch());

        const int result = atSteadySecond([&](qint64 now) {
            RecordFields alice;
            alice.removeStatus = removeStatus;
            alice.lastLoginTime = quint64(now - age);
            // The stored period plays no part in the decision.
            alice.cacheEffectiveSeconds = Q_UINT64_C(1) << 40;
            return writeBytes(root.workDir() + QStringLiteral("/10001"), recordFile(alice))
                && writeBytes(root.workDir() + QStringLiteral("/20002"), recordFile(bob))
                && ::checkOfflineLogin(account);
        });
        QCOMPARE(result, expected ? 1 : 0);
        QCOMPARE(warnings(), warning.isEmpty() ? QStringList() : QStringList { warning });
    }

    void emptyWorkingDirectory()
    {
        TestRoot root;
        QVERIFY(root.writeSettings(settings("true", "7")));
        SyslogCapture::clear();
        QVERIFY(!::checkOfflineLogin(QStringLiteral("@alice")));
        QCOMPARE(warnings(), QStringList { kNotFound });
    }

    // A record file holding nothing but the version: found for the empty account name, then read as
    // a record that never logged in.
    void recordWithoutLoginTime()
    {
        TestRoot root;
        QVERIFY(root.writeSettings(settings("true", "7")));
        QVERIFY(writeBytes(root.workDir() + QStringLiteral("/10001"), QByteArray::fromHex("00000001")));
        SyslogCapture::clear();
        QVERIFY(!::checkOfflineLogin(QString()));
        QCOMPARE(warnings(), QStringList { kExpired });
    }
};

QTEST_GUILESS_MAIN(OfflineLoginTest)
#include "test_offlinelogin.moc"
