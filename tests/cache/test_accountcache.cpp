#include "cachestore.h"
#include "messagehandler.h"
#include "offlinelogin.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDateTime>
#include <QDir>
#include <QJsonArray>
#include <QJsonObject>
#include <QTest>
#include <QThread>

#include <atomic>
#include <unistd.h>

// Largest heap request while probing (-1: not probing): an announced string length must never become one
// allocation. The sanitizer build owns malloc itself, so there nothing is recorded.
static std::atomic<long long> largest { -1 };
#if !defined(__SANITIZE_ADDRESS__)
extern "C" void *__libc_malloc(size_t size);
extern "C" void *malloc(size_t size) noexcept
{
    if (largest >= 0 && static_cast<long long>(size) > largest)
        largest = static_cast<long long>(size);
    return __libc_malloc(size);
}
#endif

class AccountCacheTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init()
    {
        QVERIFY(m_root.isValid() && QDir(m_root.workDir()).removeRecursively() && QDir().mkpath(m_root.workDir()));
        SyslogCapture::clear();
    }

    // A record read from a file with a stale encrypted zone goes back without it, over a longer world-writable file:
    // the bytes built here, owner-only. A record without a version is not written.
    void forms()
    {
        const QByteArray zoned = recordFile(10001, "@alice", 0, 1700000000, "cipher");
        QVERIFY(put("10001", le(kCacheVersion1_0, 4) + le(6, 4) + le(9, 4) + zoned.mid(12)));
        CacheControlPtr record = createCacheControl();
        record->readFromFile(at("10001"));
        QVERIFY(put("10001", QByteArray(4096, 'z')) && QFile::setPermissions(at("10001"), QFile::Permissions(0x6666)));
        QVERIFY(saveCacheRecord(*record));
        QCOMPARE(m_root.readFile(kDir + QLatin1String("10001")).toHex(), recordFile().toHex());
        QCOMPARE(QFile::permissions(at("10001")), QFile::Permissions(0x6600));
        QVERIFY(!createCacheControl()->writeToFile(at("unversioned")) && !QFile::exists(at("unversioned")));

        // Through its JSON form, where a uid beyond 2^31 is a negative number; with count 2 and three names the file
        // takes two. Each refusal warns and leaves the record as it was.
        QJsonObject json = QJsonDocument::fromJson(record->toJsonString(QJsonDocument::Compact).toUtf8()).object();
        json.insert(QStringLiteral("uid"), -294967296);
        json.insert(QStringLiteral("remove_status"), 3);
        json.insert(QStringLiteral("function_group_list"),
            QJsonArray { QStringLiteral("dev"), QStringLiteral("ops"), QStringLiteral("qa") });
        record.reset();
        QVERIFY(cacheRecordFromJson(record, QString::fromUtf8(QJsonDocument(json).toJson())));
        QVERIFY(record->writeToFile(at("10001")));
        QCOMPARE(m_root.readFile(kDir + QLatin1String("10001")).toHex(), recordFile(4000000000u, "@alice", 3).toHex());
        QVERIFY(!record->fromJsonString(QStringLiteral("[1, 2]")) && !record->fromJsonString(QStringLiteral("{")));
        QCOMPARE(record->uid(), 4000000000u);
        QVERIFY(!cacheRecordFromJson(record, QStringLiteral("{\"version\": 2}")) && record.isNull());
        QCOMPARE(SyslogCapture::lines().size(), 3);
    }

    void readFromFile_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<QString>("result"); // what it returned, then version, uid, account, main gid
        const auto row = [](const char *name, const QByteArray &file, const char *result) {
            QTest::newRow(name) << file << QString::fromLatin1(result);
        };
        const QByteArray start = le(kCacheVersion1_0, 4) + le(0, 8) + le(10001, 4);
        // A stale encrypted zone is read and skipped in forms().
        row("missing", QByteArray(), "0 0|0||0");
        row("1.0 plus one", le(0x01000001, 4) + start.mid(4), "0 16777217|0||0");
        row("cut inside the account", recordFile().left(23), "1 16777216|10001|@al|0");
        row("account of nearly 4 GiB", start + le(0xFFFFFFF0u, 4) + "@alice", "1 16777216|10001|@alice|0");
        row("zero byte inside the account", start + str(QByteArray("@al\0ice", 7)) + le(4242, 4),
            "1 16777216|10001|@al|4242");
    }

    void readFromFile()
    {
        QFETCH(QByteArray, content);
        QVERIFY(content.isNull() || put("10001", content));
        const CacheControlPtr record = createCacheControl();
        largest = 0;
        const bool result = record->readFromFile(at("10001"));
        const long long peak = largest.exchange(-1);
        QVERIFY2(peak < 1024 * 1024, qPrintable(QString::number(peak)));
        QTEST(QString::asprintf("%d %u|%u|%s|%u", result, record->storedVersion(), record->uid(),
                  qUtf8Printable(record->account()), record->mainGid()),
            "result");
    }

    // Only regular files named by digits are records. The clean-up keeps those below 10000 and hands the others
    // to root before it deletes them; the removal of all leaves what is not a record, a link's target included.
    void store()
    {
        for (const char *name : { "999", "9999", "10000", "65534" })
            QVERIFY(put(name, recordFile(QByteArray(name).toUInt())));
        QVERIFY(put("10001", recordFile()) && put("20002", recordFile(20002, "@bob")) && put("10001.bak", "x"));
        QVERIFY(put("abc", "x") && m_root.writeFile(QStringLiteral("/linked"), recordFile(10003)));
        QVERIFY(QDir().mkpath(at("10002")) && QFile::link(m_root.filePath(QStringLiteral("/linked")), at("10003")));
        // A second name of 10000 outlives the deletion and shows that the owner was changed before it.
        const QByteArray second = QFile::encodeName(m_root.filePath(QStringLiteral("/second")));
        QVERIFY(::link(QFile::encodeName(at("10000")).constData(), second.constData()) == 0
            && ::chown(second.constData(), 12345, 12345) == 0);

        QCOMPARE(uids(), (QList<quint32> { 999, 9999, 10000, 10001, 20002, 65534 }));
        quint32 uid = 0;
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid) && uid == 20002);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@Alice"), uid) && uid == 0);
        // A known uid that holds another account leaves the search to the listing.
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid, 10001) && uid == 20002);

        ::cleanDomainUserCacheFiles();
        QCOMPARE(uids(), (QList<quint32> { 999, 9999 }));
        QCOMPARE(QFileInfo(QFile::decodeName(second)).ownerId() | QFileInfo(QFile::decodeName(second)).groupId(), 0u);
        SyslogCapture::clear();
        removeAllCacheFiles();
        const QDir::Filters all = QDir::AllEntries | QDir::System | QDir::NoDotAndDotDot;
        QCOMPARE(QDir(m_root.workDir()).entryList(all, QDir::Name).join(QLatin1Char(' ')),
            QStringLiteral("10001.bak 10002 10003 abc"));
        QVERIFY(QFile::exists(m_root.filePath(QStringLiteral("/linked"))) && SyslogCapture::lines().isEmpty());
    }

    // A record kept from an earlier read must give way to any later change of its file, the same size
    // included, and a link put in its place answers nothing.
    void readCacheRecordSeesChanges()
    {
        QFile file(at("10001"));
        QVERIFY(put("10001", recordFile()) && file.open(QIODevice::ReadOnly)
            && file.setFileTime(QDateTime::currentDateTime().addSecs(-60), QFileDevice::FileModificationTime));
        // Past the time within which a file's time stamps may not show a further change.
        QThread::msleep(150);
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 0u);
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 0u);
        QVERIFY(put("10001", recordFile(10001, "@alice", 1)));
        QCOMPARE(readCacheRecord(10001)->removeStatus(), 1u);
        QVERIFY(put("other", recordFile(10001, "@alice", 2)) && QFile::remove(at("10001"))
            && QFile::link(at("other"), at("10001")));
        QVERIFY(readCacheRecord(10001).isNull());
    }

    // Each refusal logs one warning.
    void checkOfflineLogin_data()
    {
        QTest::addColumn<int>("days"); // the validity; below 0: offline login switched off
        QTest::addColumn<quint32>("removeStatus");
        QTest::addColumn<qint64>("age"); // seconds from the last login to now; below 0: no record
        QTest::addColumn<bool>("allowed");
        const qint64 week = 7 * 86400;
        QTest::newRow("exactly seven days") << 7 << 0u << week << true;
        QTest::newRow("seven days and a second") << 7 << 0u << week + 1 << false;
        QTest::newRow("no record") << 7 << 0u << qint64(-1) << false;
        QTest::newRow("marked for deletion") << 7 << 4000000000u << qint64(0) << false;
        QTest::newRow("switched off") << -7 << 0u << qint64(0) << false;
        // 49711 days are 63104 s in 32 bits: the validity wraps.
        QTest::newRow("wrapped validity, past it") << 49711 << 0u << qint64(63105) << false;
    }

    void checkOfflineLogin()
    {
        QFETCH(int, days);
        QFETCH(quint32, removeStatus);
        QFETCH(qint64, age);
        QVERIFY(m_root.writeSettings("[offline_login]\nenable=" + QByteArray(days > 0 ? "true" : "false")
            + "\ncache_validity=" + QByteArray::number(qAbs(days)) + '\n'));
        // The decision depends on the current second: repeat when the clock moved on meanwhile.
        qint64 now = 0;
        bool allowed = false;
        for (int attempt = 0; attempt < 10 && now != QDateTime::currentSecsSinceEpoch(); ++attempt) {
            SyslogCapture::clear();
            now = QDateTime::currentSecsSinceEpoch();
            QVERIFY(age < 0 || put("10001", recordFile(10001, "@alice", removeStatus, quint64(now - age))));
            allowed = ::checkOfflineLogin(QStringLiteral("@alice"));
        }
        QTEST(allowed, "allowed");
        QCOMPARE(SyslogCapture::lines().size(), allowed ? 0 : 1);
    }

private:
    // Record files are built here byte by byte, without the code under test.
    static QByteArray le(quint64 value, int size)
    {
        return size ? char(value) + le(value >> 8, size - 1) : QByteArray();
    }
    static QByteArray str(const QByteArray &utf8) { return le(quint64(utf8.size()), 4) + utf8; }
    static QByteArray recordFile(quint32 uid = 10001, const QByteArray &account = "@alice", quint32 removeStatus = 0,
        quint64 lastLogin = 1700000000, const QByteArray &zone = QByteArray())
    {
        return le(kCacheVersion1_0, 4) + le(0, 8) + le(uid, 4) + str(account) + le(20001, 4) + str("alice") + le(2, 4)
            + str("dev") + str("ops") + le(1, 4) + str("wheel") + str("Alice \xc3\x84. Example")
            + str("/home/remote/alice") + str("/bin/bash") + le(604800, 8) + le(lastLogin, 8) + str(zone)
            + str("5e884898da28047151d0e56f8dc6292773603d0d6aabbdd62a11ef721d1542d8") + le(removeStatus, 4);
    }
    QString at(const char *name) const { return m_root.workDir() + QLatin1Char('/') + QLatin1String(name); }
    bool put(const char *name, const QByteArray &data) { return m_root.writeFile(kDir + QLatin1String(name), data); }
    static QList<quint32> uids()
    {
        auto all = listCacheUids();
        std::sort(all.begin(), all.end());
        return all;
    }

    const QString kDir = QStringLiteral("/var/lib/libkest-iam/");
    TestRoot m_root;
};

QTEST_GUILESS_MAIN(AccountCacheTest)
#include "test_accountcache.moc"
