#include "cachestore.h"
#include "messagehandler.h"
#include "offlinelogin.h"
#include "syslogcapture.h"
#include "testroot.h"

#include <QDateTime>
#include <QDir>
#include <QJsonArray>
#include <QJsonObject>
#include <QRegularExpression>
#include <QTest>

#include <atomic>
#include <unistd.h>

// Largest heap request while probing: an announced string length must never become one allocation.
// The sanitizer build owns malloc itself, so there nothing is recorded.
static std::atomic<bool> probing { false };
static std::atomic<size_t> largest { 0 };
#if !defined(__SANITIZE_ADDRESS__)
extern "C" void *__libc_malloc(size_t size);
extern "C" void *malloc(size_t size) noexcept
{
    if (probing && size > largest)
        largest = size;
    return __libc_malloc(size);
}
#endif

namespace
{
const QByteArray kPassword = "5e884898da28047151d0e56f8dc6292773603d0d6aabbdd62a11ef721d1542d8";
const QString kExpired = QStringLiteral("[checkCacheEffectiveSeconds]: false");
const QString kMarked = QStringLiteral("[removeStatus]: The cache file is marked for deletion: ");

// Record files are built here byte by byte, without the code under test.
QByteArray le(quint64 value, int size)
{
    QByteArray bytes;
    for (int i = 0; i < size; ++i)
        bytes.append(char(value >> (8 * i)));
    return bytes;
}

QByteArray str(const QByteArray &utf8)
{
    return le(quint64(utf8.size()), 4) + utf8;
}

QByteArray recordFile(quint32 uid = 10001, const QByteArray &account = "@alice", quint32 removeStatus = 0,
    quint64 lastLogin = 1700000000, const QByteArray &zone = QByteArray(), quint32 version = kCacheVersion1_0)
{
    return le(version, 4) + le(0, 8) + le(uid, 4) + str(account) + le(20001, 4) + str("alice") + le(2, 4) + str("dev")
        + str("ops") + le(1, 4) + str("wheel") + str("Alice \xc3\x84. Example") + str("/home/remote/alice")
        + str("/bin/bash") + le(604800, 8) + le(lastLogin, 8) + str(zone) + str(kPassword) + le(removeStatus, 4);
}

// The record of recordFile() as JSON, and its fields as fieldsOf() gives them.
const QString kJson = QString::fromUtf8(
    R"({"version": 16777216, "uid": 10001, "account": "@alice", "main_gid": 20001, "main_gid_name": "alice",
    "function_group_count": 2, "function_group_list": ["dev", "ops"], "other_group_count": 1,
    "other_group_list": ["wheel"], "gecos": "Alice \u00c4. Example", "home_path": "/home/remote/alice",
    "login_shell": "/bin/bash", "cache_effective_seconds": 604800, "last_login_time": 1700000000,
    "remove_status": 0, "password": ")"
    + kPassword + "\"}");
const QString kFields = QString::fromUtf8("16777216|0|0|10001|@alice|20001|alice|2|dev,ops|1|wheel|Alice \xc3\x84. "
                                          "Example|/home/remote/alice|/bin/bash|604800|1700000000||"
    + kPassword + "|0");

QString fieldsOf(const CacheControlInterface &r)
{
    const auto n = [](quint64 value) { return QString::number(value); };
    const QChar comma(QLatin1Char(','));
    return QStringList { n(r.storedVersion()), n(r.plaintextLength()), n(r.secrettextLength()), n(r.uid()), r.account(),
        n(r.mainGid()), r.mainGidName(), n(r.functionGroupCount()), r.functionGroupList().join(comma),
        n(r.otherGroupCount()), r.otherGroupList().join(comma), r.gecos(), r.homePath(), r.loginShell(),
        n(r.cacheEffectiveSeconds()), n(r.lastLoginTime()), r.encryptedZoneInfo(), r.password(), n(r.removeStatus()) }
        .join(QLatin1Char('|'));
}

QJsonObject jsonOf(const QString &text)
{
    return QJsonDocument::fromJson(text.toUtf8()).object();
}

bool writeBytes(const QString &path, const QByteArray &bytes)
{
    QFile file(path);
    return file.open(QIODevice::WriteOnly) && file.write(bytes) == bytes.size();
}

QByteArray readBytes(const QString &path)
{
    QFile file(path);
    return file.open(QIODevice::ReadOnly) ? file.readAll() : QByteArray();
}

// Logged texts of one priority (warning by default) without the "cpu time: N, " prefix.
QStringList logged(int priority = 4)
{
    QStringList texts;
    for (const SyslogLine &line : SyslogCapture::lines())
        if (line.priority == priority)
            texts.append(QString::fromUtf8(line.text).remove(QRegularExpression(QStringLiteral("^cpu time: \\d+, "))));
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
        m_root.reset(); // the old root restores the environment it found
        m_root.reset(new TestRoot);
        QVERIFY(m_root->isValid());
        SyslogCapture::clear();
    }

    void binaryForm()
    {
        QVERIFY(writeBytes(at("10001"), recordFile()));
        const CacheControlPtr read = createCacheControl();
        QVERIFY(read->readFromFile(at("10001")));
        QCOMPARE(fieldsOf(*read), kFields);

        // Same bytes back, owner-only even over a longer world-readable file.
        QVERIFY(writeBytes(at("10001"), QByteArray(4096, 'z'))
            && QFile::setPermissions(at("10001"), QFile::Permissions(0x6666)));
        CacheControlPtr record;
        QVERIFY(cacheRecordFromJson(record, kJson) && saveCacheRecord(*record));
        QVERIFY(record->writeToFile(at("copy")));
        for (const char *name : { "10001", "copy" }) {
            QCOMPARE(readBytes(at(name)).toHex(), recordFile().toHex());
            QCOMPARE(QFile::permissions(at(name)),
                QFile::ReadOwner | QFile::WriteOwner | QFile::ReadUser | QFile::WriteUser);
        }
        QVERIFY(!createCacheControl()->writeToFile(at("unversioned")));
        QVERIFY(!QFile::exists(at("unversioned")));
        QVERIFY(logged().isEmpty());
    }

    void readFromFile_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<bool>("ok");
        QTest::addColumn<QString>("warning"); // PATH stands for the file's path
        QTest::addColumn<QString>("fields"); // the first six
        const QByteArray head = le(kCacheVersion1_0, 4) + le(0, 8) + le(10001, 4);
        QTest::newRow("missing") << QByteArray() << false << QStringLiteral("PATHis not exists !")
                                 << QStringLiteral("0|0|0|0||0");
        QTest::newRow("version only") << le(kCacheVersion1_0, 4) << true << QString()
                                      << QStringLiteral("16777216|0|0|0||0");
        QTest::newRow("1.0 plus one") << recordFile(10001, "@alice", 0, 1700000000, QByteArray(), 0x01000001) << false
                                      << QStringLiteral("version 16777217 error")
                                      << QStringLiteral("16777217|0|0|0||0");
        QTest::newRow("cut inside the account")
            << recordFile().left(23) << true << QString() << QStringLiteral("16777216|0|0|10001|@al|0");
        QTest::newRow("account longer than the file")
            << head + le(9, 4) + "@alice" << true << QString() << QStringLiteral("16777216|0|0|10001|@alice|0");
        QTest::newRow("account of nearly 4 GiB") << head + le(0xFFFFFFF0u, 4) + "@alice" << true << QString()
                                                 << QStringLiteral("16777216|0|0|10001|@alice|0");
        QTest::newRow("zero byte inside the account") << head + str(QByteArray("@al\0ice", 7)) + le(4242, 4) << true
                                                      << QString() << QStringLiteral("16777216|0|0|10001|@al|4242");
    }

    void readFromFile()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, ok);
        QFETCH(QString, warning);
        QFETCH(QString, fields);
        if (!content.isNull())
            QVERIFY(writeBytes(at("10001"), content));
        const CacheControlPtr record = createCacheControl();
        largest = 0;
        probing = true;
        const bool result = record->readFromFile(at("10001"));
        probing = false;
        QVERIFY2(largest < 1024 * 1024, qPrintable(QString::number(largest)));
        QCOMPARE(result, ok);
        warning.replace(QLatin1String("PATH"), at("10001"));
        QCOMPARE(logged(), warning.isEmpty() ? QStringList() : QStringList { warning });
        QCOMPARE(fieldsOf(*record).section(QLatin1Char('|'), 0, 5), fields);
    }

    void nonEmptyZone()
    {
        const QByteArray zoned = recordFile(10001, "@alice", 0, 1700000000, "cipher");
        QVERIFY(writeBytes(at("10001"), le(kCacheVersion1_0, 4) + le(6, 4) + le(9, 4) + zoned.mid(12)));
        const CacheControlPtr record = createCacheControl();
        QVERIFY(!record->readFromFile(at("10001")));
        QVERIFY(!record->verifyEncryptedZone());
        QCOMPARE(fieldsOf(*record).section(QLatin1Char('|'), 1, 2), QStringLiteral("6|9"));
        QCOMPARE(record->encryptedZoneInfo(), QStringLiteral("cipher"));

        const QJsonObject json = jsonOf(record->toJsonString(QJsonDocument::Compact));
        QCOMPARE(json.value(QStringLiteral("encrypted_zone_info")).toString(QStringLiteral("absent")), QString());
        QCOMPARE(json.value(QStringLiteral("plaintext_length")).toInt(-1), 0);
        QCOMPARE(json.value(QStringLiteral("secrettext_length")).toInt(-1), 0);
        QCOMPARE(fieldsOf(*record), kFields);
        QVERIFY(record->verifyEncryptedZone());
    }

    void jsonForm()
    {
        CacheControlPtr original;
        QVERIFY(cacheRecordFromJson(original, kJson));
        original->setUid(4000000000u);
        original->setRemoveStatus(3);
        original->setAuxiliaryText(QStringLiteral("in memory only"));
        const QString json = original->toJsonString(QJsonDocument::Indented);
        QCOMPARE(jsonOf(json).value(QStringLiteral("uid")).toDouble(), -294967296.0);
        const CacheControlPtr copy = createCacheControl();
        QVERIFY(copy->fromJsonString(json));
        QCOMPARE(fieldsOf(*copy), fieldsOf(*original));
        QVERIFY(copy->auxiliaryText().isEmpty());

        // Count 2 with three names: the file takes two, the JSON all three.
        QJsonObject object = jsonOf(json);
        object.insert(QStringLiteral("function_group_list"),
            QJsonArray { QStringLiteral("dev"), QStringLiteral("ops"), QStringLiteral("qa") });
        QVERIFY(copy->fromJsonString(QString::fromUtf8(QJsonDocument(object).toJson())));
        QVERIFY(copy->writeToFile(at("10001")));
        QCOMPARE(readBytes(at("10001")).toHex(), recordFile(4000000000u, "@alice", 3).toHex());
        const QJsonObject written = jsonOf(copy->toJsonString(QJsonDocument::Compact));
        QCOMPARE(written.value(QStringLiteral("function_group_count")).toInt(), 2);
        QCOMPARE(written.value(QStringLiteral("function_group_list")).toArray().size(), 3);

        // Refusals leave the record as it was.
        QJsonParseError error;
        const QString half = QStringLiteral("{\"version\": 16777216, \"uid\": ");
        QJsonDocument::fromJson(half.toUtf8(), &error);
        QVERIFY(!copy->fromJsonString(QStringLiteral("[1, 2]")));
        QVERIFY(!copy->fromJsonString(half));
        QCOMPARE(copy->uid(), 4000000000u);
        QVERIFY(!cacheRecordFromJson(original, QStringLiteral("{\"version\": 2}")));
        QVERIFY(original.isNull());
        QCOMPARE(logged(),
            (QStringList { QStringLiteral("json is not an object !!!"),
                QStringLiteral("fromJsonString error : ") + error.errorString(),
                QStringLiteral("invalid cache control version.") }));
    }

    void listing()
    {
        const QByteArray backup = recordFile(10001, "@backup");
        QVERIFY(writeBytes(at("10001"), recordFile()));
        QVERIFY(writeBytes(at("20002"), recordFile(20002, "@bob")));
        const QString target = m_root->path() + QStringLiteral("/linked");
        QVERIFY(writeBytes(at("10001.bak"), backup) && writeBytes(at("abc"), backup) && writeBytes(target, backup));
        QVERIFY(QDir().mkpath(at("10002")) && QFile::link(target, at("10003")));

        QStringList files = listCacheFiles();
        files.sort();
        QCOMPARE(files, (QStringList { at("10001"), at("20002") }));
        QList<quint32> uids = listCacheUids();
        std::sort(uids.begin(), uids.end());
        QCOMPARE(uids, (QList<quint32> { 10001, 20002 }));
        quint32 uid = 0;
        QVERIFY(findCacheUidByAccount(QStringLiteral("@bob"), uid) && uid == 20002);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@Alice"), uid) && uid == 0);
        QVERIFY(!findCacheUidByAccount(QStringLiteral("@backup"), uid) && uid == 0);
        removeAllCacheFiles();
        QCOMPARE(QDir(m_root->workDir()).entryList(QDir::AllEntries | QDir::System | QDir::NoDotAndDotDot, QDir::Name),
            (QStringList { QStringLiteral("10001.bak"), QStringLiteral("10002"), QStringLiteral("10003"),
                QStringLiteral("abc") }));
        QVERIFY(QFile::exists(target));
        QVERIFY(logged().isEmpty());
    }

    void cleanDomainUserCacheFiles()
    {
        const char *const kept[] = { "999", "9999", "abc" };
        QStringList info;
        for (const char *name : kept) {
            QVERIFY(writeBytes(at(name), "x"));
            info.append(QStringLiteral("not domain user cache file: ") + at(name));
        }
        QVERIFY(writeBytes(at("10000"), recordFile()) && writeBytes(at("65534"), recordFile()));
        // A second name of 10000 outlives the deletion and shows that the owner was changed before it.
        const QString second = m_root->path() + QStringLiteral("/second");
        QVERIFY(::link(QFile::encodeName(at("10000")).constData(), QFile::encodeName(second).constData()) == 0);
        QVERIFY(::chown(QFile::encodeName(second).constData(), 12345, 12345) == 0);

        ::cleanDomainUserCacheFiles();
        QVERIFY(!QFile::exists(at("10000")) && !QFile::exists(at("65534")));
        QCOMPARE((QList<uint> { QFileInfo(second).ownerId(), QFileInfo(second).groupId() }), (QList<uint> { 0, 0 }));
        for (const char *name : kept)
            QVERIFY(QFile::exists(at(name)));
        QStringList infoLogged = logged(6);
        infoLogged.sort();
        QCOMPARE(infoLogged, info);
        QVERIFY(logged().isEmpty());

        QVERIFY(QDir(m_root->workDir()).removeRecursively());
        QVERIFY(listCacheFiles().isEmpty());
        ::cleanDomainUserCacheFiles();
        QCOMPARE(logged(), QStringList { QStringLiteral("service working directory is not exists.") });
    }

    void checkOfflineLogin_data()
    {
        QTest::addColumn<QByteArray>("ini");
        QTest::addColumn<QString>("account");
        QTest::addColumn<quint32>("removeStatus");
        QTest::addColumn<qint64>("age"); // seconds from the last login to now
        QTest::addColumn<QString>("warning"); // empty: allowed
        const QByteArray on("[offline_login]\nenable=true\ncache_validity=7\n");
        const QByteArray off("[offline_login]\nenable=false\ncache_validity=7\n");
        const QByteArray wrapped("[offline_login]\nenable=true\ncache_validity=49711\n");
        const QString alice = QStringLiteral("@alice");
        const qint64 week = 7 * 86400;
        QTest::newRow("exactly seven days") << on << alice << 0u << week << QString();
        QTest::newRow("seven days and a second") << on << alice << 0u << week + 1 << kExpired;
        QTest::newRow("no record of the account") << on << QStringLiteral("@carol") << 0u << qint64(0)
                                                  << QStringLiteral("[checkOfflineLogin]: Cache file not found");
        QTest::newRow("marked, expired, switched off")
            << off << alice << 4000000000u << week + 1 << kMarked + QStringLiteral("4000000000");
        QTest::newRow("expired, switched off") << off << alice << 0u << week + 1 << kExpired;
        QTest::newRow("switched off") << off << alice << 0u << qint64(0)
                                      << QStringLiteral("[offline_login_enable]: false");
        // 49711 days wrap to 63104 s in 32 bits.
        QTest::newRow("wrapped validity, at the edge") << wrapped << alice << 0u << qint64(63104) << QString();
        QTest::newRow("wrapped validity, past it") << wrapped << alice << 0u << qint64(63105) << kExpired;
    }

    void checkOfflineLogin()
    {
        QFETCH(QByteArray, ini);
        QFETCH(QString, account);
        QFETCH(quint32, removeStatus);
        QFETCH(qint64, age);
        QFETCH(QString, warning);
        QVERIFY(m_root->writeSettings(ini));
        // The decision depends on the current second: repeat when the clock moved on meanwhile.
        qint64 now = 0;
        bool allowed = false;
        for (int attempt = 0; attempt < 10 && now != QDateTime::currentSecsSinceEpoch(); ++attempt) {
            SyslogCapture::clear();
            now = QDateTime::currentSecsSinceEpoch();
            QVERIFY(writeBytes(at("10001"), recordFile(10001, "@alice", removeStatus, quint64(now - age))));
            allowed = ::checkOfflineLogin(account);
        }
        QCOMPARE(allowed, warning.isEmpty());
        QCOMPARE(logged(), warning.isEmpty() ? QStringList() : QStringList { warning });
    }

private:
    QString at(const char *name) const { return m_root->workDir() + QLatin1Char('/') + QLatin1String(name); }

    QScopedPointer<TestRoot> m_root;
};

QTEST_GUILESS_MAIN(AccountCacheTest)
#include "test_accountcache.moc"
