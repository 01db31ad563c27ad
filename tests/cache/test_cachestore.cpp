#include "cachestore.h"
#include "cachetestsupport.h"
#include "messagehandler.h"
#include "testroot.h"

#include <QDir>
#include <QTest>

#include <algorithm>
#include <sys/stat.h>
#include <unistd.h>

namespace
{
const quint32 kVersion = 0x01000000;

RecordFields fieldsFor(quint32 uid, const QByteArray &account)
{
    RecordFields fields;
    fields.uid = uid;
    fields.account = account;
    return fields;
}

struct stat statusOf(const QString &path)
{
    struct stat status = {};
    if (::lstat(QFile::encodeName(path).constData(), &status) != 0)
        status.st_mode = 0;
    return status;
}

template<typename T> QList<T> sorted(QList<T> list)
{
    std::sort(list.begin(), list.end());
    return list;
}
} // namespace

class CacheStoreTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase() { qInstallMessageHandler(messageHandler); }
    void init()
    {
        m_root.reset(new TestRoot);
        QVERIFY(m_root->isValid());
        SyslogCapture::clear();
    }
    void cleanup() { m_root.reset(); }

    void paths()
    {
        const CacheControlPtr record = createCacheControl();
        record->setUid(10001);
        QCOMPARE(cacheFilePath(*record), m_root->workDir() + QStringLiteral("/10001"));
        QCOMPARE(cacheFilePathOfUid(4294967295u), m_root->workDir() + QStringLiteral("/4294967295"));
        QVERIFY(!cacheFileExists(*record));
        QVERIFY(writeBytes(recordPath(10001), recordFile(RecordFields())));
        QVERIFY(cacheFileExists(*record));
    }

    void saveCacheRecord_data()
    {
        QTest::addColumn<bool>("existing");
        QTest::newRow("new file") << false;
        QTest::newRow("existing world-readable file") << true;
    }

    void saveCacheRecord()
    {
        QFETCH(bool, existing);
        if (existing) {
            QVERIFY(writeBytes(recordPath(10001), QByteArray(4096, 'z')));
            QVERIFY(::chmod(QFile::encodeName(recordPath(10001)).constData(), 0644) == 0);
        }
        const CacheControlPtr source = createCacheControl();
        QVERIFY(source->fromJsonString(QString::fromUtf8(jsonOf(RecordFields()))));
        QVERIFY(::saveCacheRecord(*source));
        QCOMPARE(statusOf(recordPath(10001)).st_mode & 07777, mode_t(0600));
        QCOMPARE(readBytes(recordPath(10001)).toHex(), recordFile(RecordFields()).toHex());
    }

    void saveRecordWithoutVersion()
    {
        const CacheControlPtr source = createCacheControl();
        source->setUid(10001);
        source->setAccount(QStringLiteral("@alice"));
        QVERIFY(!::saveCacheRecord(*source));
        QVERIFY(!QFile::exists(recordPath(10001)));
    }

    void loadCacheRecord_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        QTest::addColumn<bool>("expected");
        QTest::addColumn<bool>("kept"); // the caller still holds a record afterwards
        QTest::addColumn<QString>("account");
        QTest::addColumn<quint32>("uid");

        RecordFields zoned;
        zoned.zone = "cipher";
        QTest::newRow("record") << recordFile(RecordFields()) << true << true << QStringLiteral("@alice") << 10001u;
        QTest::newRow("no file") << QByteArray() << false << false << QString() << 0u;
        QTest::newRow("other version") << recordFile(RecordFields(), 0x02000000) << false << false << QString() << 0u;
        QTest::newRow("shorter than a version") << QByteArray::fromHex("000000") << false << false << QString() << 0u;
        QTest::newRow("non-empty zone") << recordFile(zoned) << false << true << QStringLiteral("@alice") << 10001u;
        QTest::newRow("version only") << QByteArray::fromHex("00000001") << true << true << QString() << 0u;
    }

    void loadCacheRecord()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, expected);
        QFETCH(bool, kept);
        QFETCH(QString, account);
        QFETCH(quint32, uid);

        if (!content.isNull())
            QVERIFY(writeBytes(recordPath(10001), content));
        CacheControlPtr loaded = createCacheControl();
        loaded->setUid(10001);
        const CacheControlInterface *const original = loaded.data();
        QCOMPARE(::loadCacheRecord(loaded), expected);
        QCOMPARE(!loaded.isNull(), kept);
        QVERIFY(warnings().isEmpty());
        if (!loaded)
            return;
        // A file of the record's own format is read into the very record handed in.
        QCOMPARE(loaded.data(), original);
        QCOMPARE(loaded->account(), account);
        QCOMPARE(loaded->uid(), uid);
    }

    void loadNullRecord()
    {
        CacheControlPtr nothing;
        QVERIFY(!::loadCacheRecord(nothing));
    }

    void cacheRecordFromJson_data()
    {
        QTest::addColumn<QString>("json");
        QTest::addColumn<bool>("startEmpty"); // the caller hands in no record
        QTest::addColumn<bool>("expected");
        QTest::addColumn<QStringList>("warnings");
        QTest::addColumn<QString>("account");

        const QString good = QString::fromUtf8(jsonOf(RecordFields()));
        const QStringList invalid { QStringLiteral("invalid cache control version.") };
        QTest::newRow("version 1.0") << good << false << true << QStringList() << QStringLiteral("@alice");
        QTest::newRow("version 1.0 into no record")
            << good << true << true << QStringList() << QStringLiteral("@alice");
        QTest::newRow("version 2") << QStringLiteral("{\"version\": 2, \"account\": \"@bob\"}") << false << false
                                   << invalid << QString();
        QTest::newRow("version absent") << QStringLiteral("{\"account\": \"@bob\"}") << false << false << invalid
                                        << QString();
        QTest::newRow("array") << QStringLiteral("[16777216]") << false << false << invalid << QString();
        QTest::newRow("broken") << QStringLiteral("{\"version\": 16777216,") << false << false << invalid << QString();
    }

    void cacheRecordFromJson()
    {
        QFETCH(QString, json);
        QFETCH(bool, startEmpty);
        QFETCH(bool, expected);
        QFETCH(QStringList, warnings);
        QFETCH(QString, account);

        CacheControlPtr filled = startEmpty ? CacheControlPtr() : createCacheControl();
        QCOMPARE(::cacheRecordFromJson(filled, json), expected);
        QCOMPARE(::warnings(), warnings);
        QCOMPARE(!filled.isNull(), expected);
        if (!filled)
            return;
        QCOMPARE(filled->account(), account);
        QCOMPARE(filled->storedVersion(), kVersion);
    }

    void uidOfCacheFilePath_data()
    {
        QTest::addColumn<QString>("path");
        QTest::addColumn<quint32>("expected");
        QTest::newRow("record") << QStringLiteral("/var/lib/libkest-iam/10001") << 10001u;
        QTest::newRow("letters") << QStringLiteral("/var/lib/libkest-iam/abc") << 0u;
        QTest::newRow("extension") << QStringLiteral("/var/lib/libkest-iam/10001.bak") << 0u;
        QTest::newRow("trailing slash") << QStringLiteral("/var/lib/libkest-iam/") << 0u;
        QTest::newRow("no directory") << QStringLiteral("10001") << 10001u;
        QTest::newRow("largest") << QStringLiteral("/x/4294967295") << 4294967295u;
        QTest::newRow("beyond 32 bits") << QStringLiteral("/x/4294967296") << 0u;
        QTest::newRow("negative") << QStringLiteral("/x/-5") << 0u;
        QTest::newRow("digits in the directory only") << QStringLiteral("/10001/abc") << 0u;
    }

    void uidOfCacheFilePath()
    {
        QFETCH(QString, path);
        QFETCH(quint32, expected);
        QCOMPARE(::uidOfCacheFilePath(path), expected);
    }

    void listing()
    {
        populate();
        QCOMPARE(sorted(listCacheFiles()), (QStringList { recordPath(10001), recordPath(20002) }));
        QCOMPARE(sorted(listCacheUids()), (QList<quint32> { 10001, 20002 }));
        QVERIFY(warnings().isEmpty());
    }

    void missingWorkingDirectory()
    {
        QVERIFY(QDir(m_root->workDir()).removeRecursively());
        QVERIFY(listCacheFiles().isEmpty());
        QVERIFY(listCacheUids().isEmpty());
        quint32 uid = 77;
        QVERIFY(!::findCacheUidByAccount(QStringLiteral("@alice"), uid));
        QCOMPARE(uid, 0u);
        ::removeAllCacheFiles();
        QVERIFY(warnings().isEmpty());
        ::cleanDomainUserCacheFiles();
        QCOMPARE(warnings(), QStringList { QStringLiteral("service working directory is not exists.") });
    }

    void findCacheUidByAccount_data()
    {
        QTest::addColumn<QString>("account");
        QTest::addColumn<bool>("found");
        QTest::addColumn<quint32>("uid");
        QTest::newRow("first") << QStringLiteral("@alice") << true << 10001u;
        QTest::newRow("second") << QStringLiteral("@bob") << true << 20002u;
        QTest::newRow("case differs") << QStringLiteral("@Alice") << false << 0u;
        QTest::newRow("prefix only") << QStringLiteral("@ali") << false << 0u;
        QTest::newRow("unknown") << QStringLiteral("@carol") << false << 0u;
        QTest::newRow("only in a backup file") << QStringLiteral("@backup") << false << 0u;
        QTest::newRow("only behind a symbolic link") << QStringLiteral("@linked") << false << 0u;
        QTest::newRow("only in a file of another version") << QStringLiteral("@future") << false << 0u;
    }

    void findCacheUidByAccount()
    {
        QFETCH(QString, account);
        QFETCH(bool, found);
        QFETCH(quint32, uid);
        populate();
        QVERIFY(writeBytes(recordPath(30003), recordFile(fieldsFor(30003, "@future"), 0x02000000)));
        quint32 result = 77;
        QCOMPARE(::findCacheUidByAccount(account, result), found);
        QCOMPARE(result, uid);
        QVERIFY(warnings().isEmpty());
    }

    void removeCacheFile()
    {
        populate();
        ::removeCacheFile(10001);
        QVERIFY(!QFile::exists(recordPath(10001)));
        QVERIFY(QFile::exists(recordPath(20002)));
        QVERIFY(QFile::exists(m_root->workDir() + QStringLiteral("/10001.bak")));
        ::removeCacheFile(10001);
        ::removeCacheFile(40004);
        QVERIFY(SyslogCapture::lines().isEmpty());
    }

    void removeAllCacheFiles()
    {
        populate();
        ::removeAllCacheFiles();
        QVERIFY(!QFile::exists(recordPath(10001)));
        QVERIFY(!QFile::exists(recordPath(20002)));
        QStringList left = QDir(m_root->workDir()).entryList(QDir::AllEntries | QDir::System | QDir::NoDotAndDotDot);
        left.sort();
        QCOMPARE(left,
            (QStringList { QStringLiteral("10001.bak"), QStringLiteral("10002"), QStringLiteral("10003"),
                QStringLiteral("abc"), QStringLiteral("groups.txt") }));
        QVERIFY(QFile::exists(m_linkTarget));
        QVERIFY(SyslogCapture::lines().isEmpty());
    }

    void cleanDomainUserCacheFiles()
    {
        const QStringList kept { QStringLiteral("999"), QStringLiteral("9999"), QStringLiteral("abc"),
            QStringLiteral("groups.txt"), QStringLiteral("-10001") };
        for (const QString &name : kept)
            QVERIFY(writeBytes(m_root->workDir() + QLatin1Char('/') + name, "x"));
        QVERIFY(writeBytes(recordPath(10000), recordFile(fieldsFor(10000, "@alice"))));
        QVERIFY(writeBytes(recordPath(65534), recordFile(fieldsFor(65534, "@bob"))));
        QVERIFY(QDir().mkpath(recordPath(13000)));
        const QString target = m_root->path() + QStringLiteral("/target");
        QVERIFY(writeBytes(target, "t"));
        QVERIFY(QFile::link(target, recordPath(12000)));

        // The second name of 10000 outlives the deletion and shows what happened to the file first.
        const QString secondName = m_root->path() + QStringLiteral("/second-name-of-10000");
        QVERIFY(
            ::link(QFile::encodeName(recordPath(10000)).constData(), QFile::encodeName(secondName).constData()) == 0);
        for (const QString &path : { recordPath(10000), target })
            QVERIFY(::chown(QFile::encodeName(path).constData(), 12345, 12345) == 0);

        ::cleanDomainUserCacheFiles();

        QVERIFY(!QFile::exists(recordPath(10000)));
        QVERIFY(!QFile::exists(recordPath(65534)));
        const struct stat first = statusOf(secondName);
        QVERIFY(S_ISREG(first.st_mode));
        QCOMPARE(first.st_uid, uid_t(0));
        QCOMPARE(first.st_gid, gid_t(0));
        QCOMPARE(first.st_nlink, nlink_t(1));
        for (const QString &name : kept)
            QVERIFY2(QFile::exists(m_root->workDir() + QLatin1Char('/') + name), qPrintable(name));
        QVERIFY(S_ISLNK(statusOf(recordPath(12000)).st_mode));
        QCOMPARE(statusOf(target).st_uid, uid_t(12345));
        QVERIFY(QFileInfo(recordPath(13000)).isDir());

        QStringList expectedInfo;
        for (const QString &name : kept)
            expectedInfo.append(
                QStringLiteral("not domain user cache file: ") + m_root->workDir() + QLatin1Char('/') + name);
        QCOMPARE(sorted(loggedTexts(6)), sorted(expectedInfo));
        QVERIFY(warnings().isEmpty());
    }

    void refreshCacheRecord()
    {
        QVERIFY(writeBytes(recordPath(10001), recordFile(RecordFields()) + QByteArray("trailing")));
        QVERIFY(::chmod(QFile::encodeName(recordPath(10001)).constData(), 0644) == 0);
        QVERIFY(::refreshCacheRecord(10001));
        QCOMPARE(readBytes(recordPath(10001)).toHex(), recordFile(RecordFields()).toHex());
        QCOMPARE(statusOf(recordPath(10001)).st_mode & 07777, mode_t(0600));
    }

    void refreshUnreadableRecord_data()
    {
        QTest::addColumn<QByteArray>("content"); // null: no file
        RecordFields zoned;
        zoned.zone = "cipher";
        QTest::newRow("no file") << QByteArray();
        QTest::newRow("other version") << recordFile(RecordFields(), 0x02000000);
        QTest::newRow("non-empty zone") << recordFile(zoned);
    }

    void refreshUnreadableRecord()
    {
        QFETCH(QByteArray, content);
        if (!content.isNull())
            QVERIFY(writeBytes(recordPath(10001), content));
        QVERIFY(!::refreshCacheRecord(10001));
        QCOMPARE(QFile::exists(recordPath(10001)), !content.isNull());
        QCOMPARE(readBytes(recordPath(10001)), content);
    }

private:
    QString recordPath(quint32 uid) const { return m_root->workDir() + QLatin1Char('/') + QString::number(uid); }

    static QByteArray jsonOf(const RecordFields &fields)
    {
        const CacheControlPtr source = createCacheControl();
        source->setVersion(kVersion);
        source->setUid(fields.uid);
        source->setAccount(QString::fromUtf8(fields.account));
        source->setMainGid(fields.mainGid);
        source->setMainGidName(QString::fromUtf8(fields.mainGidName));
        source->setFunctionGroupList(texts(fields.functionGroups));
        source->setOtherGroupList(texts(fields.otherGroups));
        source->setGecos(QString::fromUtf8(fields.gecos));
        source->setHomePath(QString::fromUtf8(fields.homePath));
        source->setLoginShell(QString::fromUtf8(fields.loginShell));
        source->setCacheEffectiveSeconds(fields.cacheEffectiveSeconds);
        source->setLastLoginTime(fields.lastLoginTime);
        source->setPassword(QString::fromUtf8(fields.password));
        source->setRemoveStatus(fields.removeStatus);
        return source->toJsonString(QJsonDocument::Compact).toUtf8();
    }

    // Two records among things that are not records.
    void populate()
    {
        QVERIFY(writeBytes(recordPath(10001), recordFile(fieldsFor(10001, "@alice"))));
        QVERIFY(writeBytes(recordPath(20002), recordFile(fieldsFor(20002, "@bob"))));
        QVERIFY(writeBytes(m_root->workDir() + QStringLiteral("/10001.bak"), recordFile(fieldsFor(10001, "@backup"))));
        QVERIFY(writeBytes(m_root->workDir() + QStringLiteral("/abc"), recordFile(fieldsFor(10001, "@abc"))));
        QVERIFY(writeBytes(m_root->workDir() + QStringLiteral("/groups.txt"), "dev:x:20000:\n"));
        QVERIFY(QDir().mkpath(recordPath(10002)));
        m_linkTarget = m_root->path() + QStringLiteral("/linked-record");
        QVERIFY(writeBytes(m_linkTarget, recordFile(fieldsFor(10003, "@linked"))));
        QVERIFY(QFile::link(m_linkTarget, recordPath(10003)));
    }

    QScopedPointer<TestRoot> m_root;
    QString m_linkTarget;
};

QTEST_GUILESS_MAIN(CacheStoreTest)
#include "test_cachestore.moc"
