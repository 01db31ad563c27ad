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
#include <QtEndian>

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

namespace
{
const QByteArray kPassword = "5e884898da28047151d0e56f8dc6292773603d0d6aabbdd62a11ef721d1542d8";

// Record files are built here byte by byte, without the code under test.
QByteArray le(quint64 value, int size)
{
    const quint64 little = qToLittleEndian(value);
    return QByteArray(reinterpret_cast<const char *>(&little), size);
}

QByteArray str(const QByteArray &utf8)
{
    return le(quint64(utf8.size()), 4) + utf8;
}

QByteArray recordFile(quint32 uid = 10001, const QByteArray &account = "@alice", quint32 removeStatus = 0,
    quint64 lastLogin = 1700000000, const QByteArray &zone = QByteArray())
{
    return le(kCacheVersion1_0, 4) + le(0, 8) + le(uid, 4) + str(account) + le(20001, 4) + str("alice") + le(2, 4)
        + str("dev") + str("ops") + le(1, 4) + str("wheel") + str("Alice \xc3\x84. Example") + str("/home/remote/alice")
        + str("/bin/bash") + le(604800, 8) + le(lastLogin, 8) + str(zone) + str(kPassword) + le(removeStatus, 4);
}

// The record of recordFile() as JSON.
const QString kJson = QString::fromUtf8(
    R"({"version": 16777216, "plaintext_length": 0, "secrettext_length": 0, "uid": 10001, "account": "@alice",
    "main_gid": 20001, "main_gid_name": "alice", "function_group_count": 2, "function_group_list": ["dev", "ops"],
    "other_group_count": 1, "other_group_list": ["wheel"], "gecos": "Alice \u00c4. Example", "home_path":
    "/home/remote/alice", "login_shell": "/bin/bash", "cache_effective_seconds": 604800, "last_login_time": 1700000000,
    "encrypted_zone_info": "", "remove_status": 0, "password": ")"
    + kPassword + "\"}");

// Version, zone lengths, uid, account and main gid of a record.
QString headOf(const CacheControlInterface &r)
{
    return QString::asprintf("%u|%u|%u|%u|%s|%u", r.storedVersion(), r.plaintextLength(), r.secrettextLength(), r.uid(),
        qUtf8Printable(r.account()), r.mainGid());
}

QJsonObject jsonOf(const QString &text)
{
    return QJsonDocument::fromJson(text.toUtf8()).object();
}

// Logged texts of one priority (warning by default) without the "cpu time: N, " prefix.
QStringList logged(int priority = 4)
{
    QStringList texts;
    for (const SyslogLine &line : SyslogCapture::lines())
        if (line.priority == priority)
            texts.append(QString::fromUtf8(line.text.mid(line.text.indexOf(", ") + 2)));
    return texts;
}
} // namespace

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

    // Read with a stale encrypted zone, which the JSON form clears; written back without it. Then filled from JSON:
    // a uid beyond 2^31 goes there as its 32-bit pattern, and with count 2 and three names the file takes two.
    void forms()
    {
        const QByteArray zoned = recordFile(10001, "@alice", 0, 1700000000, "cipher");
        QVERIFY(put("10001", le(kCacheVersion1_0, 4) + le(6, 4) + le(9, 4) + zoned.mid(12)));
        CacheControlPtr record = createCacheControl();
        QVERIFY(!record->readFromFile(at("10001")) && !record->verifyEncryptedZone());
        QCOMPARE(
            headOf(*record) + record->encryptedZoneInfo(), QStringLiteral("16777216|6|9|10001|@alice|20001cipher"));
        QCOMPARE(jsonOf(record->toJsonString(QJsonDocument::Compact)), jsonOf(kJson));
        QVERIFY(record->verifyEncryptedZone());
        // Written back, to a new file and over a longer world-writable one: the same bytes, owner-only.
        QVERIFY(put("10001", QByteArray(4096, 'z')) && QFile::setPermissions(at("10001"), QFile::Permissions(0x6666)));
        QVERIFY(saveCacheRecord(*record) && record->writeToFile(at("copy")));
        for (const char *name : { "10001", "copy" }) {
            QCOMPARE(got(name).toHex(), recordFile().toHex());
            QCOMPARE(QFile::permissions(at(name)), QFile::Permissions(0x6600));
        }
        QVERIFY(!createCacheControl()->writeToFile(at("unversioned")) && !QFile::exists(at("unversioned")));

        QJsonObject json = jsonOf(kJson);
        json.insert(QStringLiteral("uid"), -294967296);
        json.insert(QStringLiteral("remove_status"), 3);
        json.insert(QStringLiteral("function_group_list"),
            QJsonArray { QStringLiteral("dev"), QStringLiteral("ops"), QStringLiteral("qa") });
        QVERIFY(cacheRecordFromJson(record, QString::fromUtf8(QJsonDocument(json).toJson())));
        record->setAuxiliaryText(QStringLiteral("in memory only"));
        QCOMPARE(jsonOf(record->toJsonString(QJsonDocument::Indented)), json);
        QVERIFY(record->writeToFile(at("10001")));
        QCOMPARE(got("10001").toHex(), recordFile(4000000000u, "@alice", 3).toHex());
        QVERIFY(logged().isEmpty());

        // Refusals leave the record as it was.
        QJsonParseError error;
        const QString half = QStringLiteral("{\"version\": 16777216, \"uid\": ");
        QJsonDocument::fromJson(half.toUtf8(), &error);
        QVERIFY(!record->fromJsonString(QStringLiteral("[1, 2]")) && !record->fromJsonString(half));
        QCOMPARE(record->uid(), 4000000000u);
        QVERIFY(!cacheRecordFromJson(record, QStringLiteral("{\"version\": 2}")) && record.isNull());
        QCOMPARE(logged().join(QLatin1Char('|')),
            QStringLiteral("json is not an object !!!|fromJsonString error : %1|invalid cache control version.")
                .arg(error.errorString()));
    }

    void readFromFile_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<bool>("ok");
        QTest::addColumn<QString>("warning"); // PATH stands for the file's path
        QTest::addColumn<QString>("head");
        const auto row = [](const char *name, const QByteArray &file, bool ok, const char *warning, const char *head) {
            QTest::newRow(name) << file << ok << QString::fromLatin1(warning) << QString::fromLatin1(head);
        };
        const QByteArray start = le(kCacheVersion1_0, 4) + le(0, 8) + le(10001, 4);
        row("missing", QByteArray(), false, "PATHis not exists !", "0|0|0|0||0");
        row("version only", start.left(4), true, "", "16777216|0|0|0||0");
        row("1.0 plus one", le(0x01000001, 4) + start.mid(4), false, "version 16777217 error", "16777217|0|0|0||0");
        row("cut inside the account", recordFile().left(23), true, "", "16777216|0|0|10001|@al|0");
        row("account longer than the file", start + le(9, 4) + "@alice", true, "", "16777216|0|0|10001|@alice|0");
        row("account of nearly 4 GiB", start + le(0xFFFFFFF0u, 4) + "@alice", true, "", "16777216|0|0|10001|@alice|0");
        row("zero byte inside the account", start + str(QByteArray("@al\0ice", 7)) + le(4242, 4), true, "",
            "16777216|0|0|10001|@al|4242");
    }

    void readFromFile()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, ok);
        QFETCH(QString, warning);
        QFETCH(QString, head);
        QVERIFY(content.isNull() || put("10001", content));
        const CacheControlPtr record = createCacheControl();
        largest = 0;
        const bool result = record->readFromFile(at("10001"));
        const long long peak = largest.exchange(-1);
        QVERIFY2(peak < 1024 * 1024, qPrintable(QString::number(peak)));
        QCOMPARE(result, ok);
        QCOMPARE(logged().join(QLatin1Char('\n')), warning.replace(QLatin1String("PATH"), at("10001")));
        QCOMPARE(headOf(*record), head);
    }

    // Only regular files named by digits are records; the clean-up keeps those below 10000.
    void store()
    {
        const QByteArray backup = recordFile(10001, "@backup");
        for (const char *name : { "999", "9999", "10000", "65534" })
            QVERIFY(put(name, recordFile(QByteArray(name).toUInt())));
        QVERIFY(put("10001", recordFile()) && put("20002", recordFile(20002, "@bob")) && put("10001.bak", backup));
        QVERIFY(put("abc", backup) && m_root.writeFile(QStringLiteral("/linked"), backup));
        QVERIFY(QDir().mkpath(at("10002")) && QFile::link(m_root.filePath(QStringLiteral("/linked")), at("10003")));
        // A second name of 10000 outlives the deletion and shows that the owner was changed before it.
        const QString second = m_root.filePath(QStringLiteral("/second"));
        QVERIFY(::link(QFile::encodeName(at("10000")).constData(), QFile::encodeName(second).constData()) == 0);
        QVERIFY(::chown(QFile::encodeName(second).constData(), 12345, 12345) == 0);

        QCOMPARE(sorted(listCacheFiles()),
            (QStringList { at("10000"), at("10001"), at("20002"), at("65534"), at("999"), at("9999") }));
        QCOMPARE(sorted(listCacheUids()), (QList<quint32> { 999, 9999, 10000, 10001, 20002, 65534 }));
        quint32 uid = 0;
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid) && uid == 20002);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@Alice"), uid) && uid == 0);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@backup"), uid) && uid == 0);
        // A known uid is looked at first, under the rules of the listing.
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid, 10001) && uid == 20002);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@backup"), uid, 10003) && uid == 0);

        ::cleanDomainUserCacheFiles();
        QCOMPARE(sorted(listCacheFiles()), (QStringList { at("999"), at("9999") }));
        QCOMPARE(QFileInfo(second).ownerId() | QFileInfo(second).groupId(), 0u);
        QStringList info;
        for (const char *name : { "10001.bak", "999", "9999", "abc" })
            info.append(QStringLiteral("not domain user cache file: ") + at(name));
        QCOMPARE(sorted(logged(6)), info);
        removeAllCacheFiles();
        QCOMPARE(QDir(m_root.workDir())
                     .entryList(QDir::AllEntries | QDir::System | QDir::NoDotAndDotDot, QDir::Name)
                     .join(QLatin1Char(' ')),
            QStringLiteral("10001.bak 10002 10003 abc"));
        QVERIFY(QFile::exists(m_root.filePath(QStringLiteral("/linked"))));
        QVERIFY(logged().isEmpty());

        QVERIFY(QDir(m_root.workDir()).removeRecursively());
        QVERIFY(listCacheFiles().isEmpty());
        ::cleanDomainUserCacheFiles();
        QCOMPARE(logged(), QStringList { QStringLiteral("service working directory is not exists.") });
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

    void checkOfflineLogin_data()
    {
        QTest::addColumn<QByteArray>("ini");
        QTest::addColumn<QString>("account");
        QTest::addColumn<quint32>("removeStatus");
        QTest::addColumn<qint64>("age"); // seconds from the last login to now
        QTest::addColumn<QString>("warning"); // empty: allowed
        const auto row = [](const char *name, const QByteArray &ini, const char *account, quint32 removeStatus,
                             qint64 age, const char *warning) {
            QTest::newRow(name) << ini << QString::fromLatin1(account) << removeStatus << age
                                << QString::fromLatin1(warning);
        };
        const QByteArray on("[offline_login]\nenable=true\ncache_validity=7\n");
        const QByteArray off("[offline_login]\nenable=false\ncache_validity=7\n");
        const QByteArray wrapped("[offline_login]\nenable=true\ncache_validity=49711\n"); // 63104 s in 32 bits
        const char *const expired = "[checkCacheEffectiveSeconds]: false";
        const qint64 week = 7 * 86400;
        row("exactly seven days", on, "@alice", 0, week, "");
        row("seven days and a second", on, "@alice", 0, week + 1, expired);
        row("no record of the account", on, "@carol", 0, 0, "[checkOfflineLogin]: Cache file not found");
        row("marked, expired, switched off", off, "@alice", 4000000000u, week + 1,
            "[removeStatus]: The cache file is marked for deletion: 4000000000");
        row("expired, switched off", off, "@alice", 0, week + 1, expired);
        row("switched off", off, "@alice", 0, 0, "[offline_login_enable]: false");
        row("wrapped validity, at the edge", wrapped, "@alice", 0, 63104, "");
        row("wrapped validity, past it", wrapped, "@alice", 0, 63105, expired);
    }

    void checkOfflineLogin()
    {
        QFETCH(QByteArray, ini);
        QFETCH(QString, account);
        QFETCH(quint32, removeStatus);
        QFETCH(qint64, age);
        QFETCH(QString, warning);
        QVERIFY(m_root.writeSettings(ini));
        // The decision depends on the current second: repeat when the clock moved on meanwhile.
        qint64 now = 0;
        bool allowed = false;
        for (int attempt = 0; attempt < 10 && now != QDateTime::currentSecsSinceEpoch(); ++attempt) {
            SyslogCapture::clear();
            now = QDateTime::currentSecsSinceEpoch();
            QVERIFY(put("10001", recordFile(10001, "@alice", removeStatus, quint64(now - age))));
            allowed = ::checkOfflineLogin(account);
        }
        QCOMPARE(allowed, warning.isEmpty());
        QCOMPARE(logged(), warning.isEmpty() ? QStringList() : QStringList { warning });
    }

private:
    QString at(const char *name) const { return m_root.workDir() + QLatin1Char('/') + QLatin1String(name); }
    bool put(const char *name, const QByteArray &data) { return m_root.writeFile(kDir + QLatin1String(name), data); }
    QByteArray got(const char *name) const { return m_root.readFile(kDir + QLatin1String(name)); }
    template<typename List> static List sorted(List list)
    {
        std::sort(list.begin(), list.end());
        return list;
    }

    const QString kDir = QStringLiteral("/var/lib/libkest-iam/");
    TestRoot m_root;
};

QTEST_GUILESS_MAIN(AccountCacheTest)
#include "test_accountcache.moc"
