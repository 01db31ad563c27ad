#include "cachecontrolfactory.h"
#include "cachetestsupport.h"
#include "messagehandler.h"
#include "testroot.h"

#include <QBuffer>
#include <QDataStream>
#include <QJsonArray>
#include <QJsonObject>
#include <QTest>

#include <sys/stat.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <limits>

// Largest single heap request while probing: shows that an announced string length never becomes an
// allocation. The sanitizer build owns malloc itself, so there the probe is left out.
#if defined(__SANITIZE_ADDRESS__)
#define ALLOCATION_PROBE 0
#else
#define ALLOCATION_PROBE 1
namespace
{
std::atomic<bool> probing { false };
std::atomic<size_t> largestRequest { 0 };

void noteRequest(size_t size)
{
    if (!probing.load(std::memory_order_relaxed))
        return;
    size_t largest = largestRequest.load(std::memory_order_relaxed);
    while (size > largest && !largestRequest.compare_exchange_weak(largest, size))
        ;
}
} // namespace

extern "C" {
void *__libc_malloc(size_t size);
void *__libc_realloc(void *pointer, size_t size);

void *malloc(size_t size) noexcept
{
    noteRequest(size);
    return __libc_malloc(size);
}

void *realloc(void *pointer, size_t size) noexcept
{
    noteRequest(size);
    return __libc_realloc(pointer, size);
}
}
#endif

namespace
{
const quint32 kVersion = 0x01000000;

// A stream device that cannot tell how much is left, like a pipe.
class SequentialDevice : public QIODevice
{
public:
    explicit SequentialDevice(const QByteArray &data)
        : m_data(data)
    {
    }
    bool isSequential() const override { return true; }

protected:
    qint64 readData(char *data, qint64 maxSize) override
    {
        const qint64 count = qMin<qint64>(maxSize, m_data.size() - m_position);
        memcpy(data, m_data.constData() + m_position, size_t(count));
        m_position += int(count);
        return count;
    }
    qint64 writeData(const char *, qint64) override { return -1; }

private:
    QByteArray m_data;
    int m_position = 0;
};

CacheControlPtr filledRecord()
{
    const RecordFields fields;
    CacheControlPtr record = createCacheControl();
    record->setVersion(kVersion);
    record->setUid(fields.uid);
    record->setAccount(QString::fromUtf8(fields.account));
    record->setMainGid(fields.mainGid);
    record->setMainGidName(QString::fromUtf8(fields.mainGidName));
    record->setFunctionGroupList(texts(fields.functionGroups));
    record->setOtherGroupList(texts(fields.otherGroups));
    record->setGecos(QString::fromUtf8(fields.gecos));
    record->setHomePath(QString::fromUtf8(fields.homePath));
    record->setLoginShell(QString::fromUtf8(fields.loginShell));
    record->setCacheEffectiveSeconds(fields.cacheEffectiveSeconds);
    record->setLastLoginTime(fields.lastLoginTime);
    record->setPassword(QString::fromUtf8(fields.password));
    record->setRemoveStatus(fields.removeStatus);
    return record;
}

void compareWithFields(const CacheControlInterface &record, const RecordFields &fields)
{
    QCOMPARE(record.storedVersion(), kVersion);
    QCOMPARE(record.plaintextLength(), 0u);
    QCOMPARE(record.secrettextLength(), 0u);
    QCOMPARE(record.uid(), fields.uid);
    QCOMPARE(record.account(), QString::fromUtf8(fields.account));
    QCOMPARE(record.mainGid(), fields.mainGid);
    QCOMPARE(record.mainGidName(), QString::fromUtf8(fields.mainGidName));
    QCOMPARE(record.functionGroupCount(), quint32(fields.functionGroups.size()));
    QCOMPARE(record.functionGroupList(), texts(fields.functionGroups));
    QCOMPARE(record.otherGroupCount(), quint32(fields.otherGroups.size()));
    QCOMPARE(record.otherGroupList(), texts(fields.otherGroups));
    QCOMPARE(record.gecos(), QString::fromUtf8(fields.gecos));
    QCOMPARE(record.homePath(), QString::fromUtf8(fields.homePath));
    QCOMPARE(record.loginShell(), QString::fromUtf8(fields.loginShell));
    QCOMPARE(record.cacheEffectiveSeconds(), fields.cacheEffectiveSeconds);
    QCOMPARE(record.lastLoginTime(), fields.lastLoginTime);
    QCOMPARE(record.encryptedZoneInfo(), QString::fromUtf8(fields.zone));
    QCOMPARE(record.password(), QString::fromUtf8(fields.password));
    QCOMPARE(record.removeStatus(), fields.removeStatus);
}

QJsonObject jsonObjectOf(const QString &text)
{
    return QJsonDocument::fromJson(text.toUtf8()).object();
}
} // namespace

class CacheRecordTest : public QObject
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

    void integersAreRawLittleEndian()
    {
        QByteArray bytes;
        QBuffer buffer(&bytes);
        buffer.open(QIODevice::ReadWrite);
        QDataStream stream(&buffer);
        const CacheControlPtr record = createCacheControl();
        QVERIFY(record->writeUInt32(stream, kVersion));
        QVERIFY(record->writeUInt64(stream, Q_UINT64_C(0x0102030405060708)));
        QVERIFY(record->writeString(stream, QStringLiteral("\u00c4b")));
        QVERIFY(record->writeString(stream, QString()));
        QCOMPARE(bytes.toHex(),
            QByteArray("00000001"
                       "0807060504030201"
                       "03000000c38462"
                       "00000000"));

        buffer.seek(0);
        quint32 version = 0;
        quint64 wide = 0;
        QString text;
        QVERIFY(record->readUInt32(stream, version));
        QCOMPARE(version, kVersion);
        QVERIFY(record->readUInt64(stream, wide));
        QCOMPARE(wide, Q_UINT64_C(0x0102030405060708));
        quint32 length = 0;
        QVERIFY(record->readUInt32(stream, length));
        QVERIFY(record->readString(stream, length, text));
        QCOMPARE(text, QStringLiteral("\u00c4b"));
        QVERIFY(record->readUInt32(stream, length));
        QCOMPARE(length, 0u);
        QVERIFY(!record->readUInt32(stream, length));
        QCOMPARE(length, 0u);
        QVERIFY(!record->readUInt64(stream, wide));
        QCOMPARE(wide, Q_UINT64_C(0));
    }

    void readString_data()
    {
        QTest::addColumn<QByteArray>("data");
        QTest::addColumn<quint32>("length");
        QTest::addColumn<bool>("sequential");
        QTest::addColumn<bool>("expected");
        QTest::addColumn<QString>("text");

        for (const bool sequential : { false, true }) {
            const char *kind = sequential ? "sequential" : "file";
            QTest::addRow("%s exact", kind) << QByteArray("abc") << 3u << sequential << true << QStringLiteral("abc");
            QTest::addRow("%s longer data", kind)
                << QByteArray("abcdef") << 2u << sequential << true << QStringLiteral("ab");
            QTest::addRow("%s zero length", kind) << QByteArray("abc") << 0u << sequential << true << QString();
            QTest::addRow("%s zero byte inside", kind)
                << QByteArray("ab\0cd", 5) << 5u << sequential << true << QStringLiteral("ab");
            QTest::addRow("%s zero byte first", kind) << QByteArray("\0cd", 3) << 3u << sequential << true << QString();
            QTest::addRow("%s one past the end", kind)
                << QByteArray("abc") << 4u << sequential << false << QStringLiteral("abc");
            QTest::addRow("%s nearly 4 GiB announced", kind)
                << QByteArray("abc") << 0xFFFFFFF0u << sequential << false << QStringLiteral("abc");
            QTest::addRow("%s nothing left", kind) << QByteArray() << 8u << sequential << false << QString();
            QTest::addRow("%s long text", kind)
                << QByteArray(200000, 'x') << 200000u << sequential << true << QString(200000, QLatin1Char('x'));
        }
    }

    void readString()
    {
        QFETCH(QByteArray, data);
        QFETCH(quint32, length);
        QFETCH(bool, sequential);
        QFETCH(bool, expected);
        QFETCH(QString, text);

        QBuffer buffer(&data);
        SequentialDevice pipe(data);
        QIODevice *device = sequential ? static_cast<QIODevice *>(&pipe) : &buffer;
        QVERIFY(device->open(QIODevice::ReadOnly));
        QDataStream stream(device);
        const CacheControlPtr record = createCacheControl();
        QString result = QStringLiteral("previous");
#if ALLOCATION_PROBE
        largestRequest = 0;
        probing = true;
#endif
        const bool ok = record->readString(stream, length, result);
#if ALLOCATION_PROBE
        probing = false;
        QVERIFY2(largestRequest < size_t(data.size()) * 4 + 256 * 1024,
            qPrintable(QStringLiteral("largest allocation %1").arg(largestRequest)));
#endif
        QCOMPARE(ok, expected);
        QCOMPARE(result, text);
    }

    void readStringWithoutDevice()
    {
        QDataStream stream;
        QString text = QStringLiteral("previous");
        QVERIFY(!createCacheControl()->readString(stream, 3, text));
        QVERIFY(text.isEmpty());
    }

    void readsFileBuiltByteByByte()
    {
        const RecordFields fields;
        const QByteArray bytes = recordFile(fields);
        QCOMPARE(bytes.left(4).toHex(), QByteArray("00000001"));
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(writeBytes(path, bytes));

        const CacheControlPtr record = createCacheControl();
        QVERIFY(record->readFromFile(path));
        compareWithFields(*record, fields);
        QVERIFY(warnings().isEmpty());

        // Reading back and writing again gives the very same bytes.
        const QString copy = m_root->workDir() + QStringLiteral("/copy");
        QVERIFY(record->writeToFile(copy));
        QCOMPARE(readBytes(copy).toHex(), bytes.toHex());
    }

    void writesSameBytesAsBuiltByHand()
    {
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(filledRecord()->writeToFile(path));
        QCOMPARE(readBytes(path).toHex(), recordFile(RecordFields()).toHex());
    }

    void readFromFile_data()
    {
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<bool>("expected");
        QTest::addColumn<QStringList>("warnings");
        QTest::addColumn<quint32>("version");
        QTest::addColumn<QString>("account");
        QTest::addColumn<quint32>("mainGid");
        QTest::addColumn<QStringList>("functionGroups");
        QTest::addColumn<QString>("password");

        const RecordFields fields;
        const QByteArray full = recordFile(fields);
        const QString account = QString::fromUtf8(fields.account);
        const QString password = QString::fromUtf8(fields.password);
        const QStringList groups = texts(fields.functionGroups);
        const QByteArray head = RecordBytes().u32(kVersion).u32(0).u32(0).u32(10001).bytes();

        QTest::newRow("complete") << full << true << QStringList() << kVersion << account << fields.mainGid << groups
                                  << password;
        QTest::newRow("bytes after the record are ignored")
            << full + QByteArray("trailing") << true << QStringList() << kVersion << account << fields.mainGid << groups
            << password;
        QTest::newRow("version only") << RecordBytes().u32(kVersion).bytes() << true << QStringList() << kVersion
                                      << QString() << 0u << QStringList() << QString();
        QTest::newRow("other version") << recordFile(fields, 0x01000001) << false
                                       << QStringList { QStringLiteral("version 16777217 error") } << 0x01000001u
                                       << QString() << 0u << QStringList() << QString();
        QTest::newRow("version zero") << recordFile(fields, 0) << false
                                      << QStringList { QStringLiteral("version 0 error") } << 0u << QString() << 0u
                                      << QStringList() << QString();
        QTest::newRow("empty file") << QByteArray() << false << QStringList { QStringLiteral("version 0 error") } << 0u
                                    << QString() << 0u << QStringList() << QString();
        QTest::newRow("cut inside the account") << full.left(head.size() + 4 + 3) << true << QStringList() << kVersion
                                                << QStringLiteral("@al") << 0u << QStringList() << QString();
        QTest::newRow("cut inside the password")
            << full.left(full.size() - 4 - 10) << true << QStringList() << kVersion << account << fields.mainGid
            << groups << password.left(password.size() - 10);
        QTest::newRow("account one longer than the file")
            << RecordBytes().raw(head).u32(9).raw("@alice").bytes() << true << QStringList() << kVersion
            << QStringLiteral("@alice") << 0u << QStringList() << QString();
        QTest::newRow("account of nearly 4 GiB")
            << RecordBytes().raw(head).u32(0xFFFFFFF0u).raw("@alice").bytes() << true << QStringList() << kVersion
            << QStringLiteral("@alice") << 0u << QStringList() << QString();
        QTest::newRow("zero byte inside the account")
            << RecordBytes().raw(head).text(QByteArray("@al\0ice", 7)).u32(4242).bytes() << true << QStringList()
            << kVersion << QStringLiteral("@al") << 4242u << QStringList() << QString();
        QTest::newRow("group count beyond the file")
            << RecordBytes().raw(head).text("@alice").u32(7).text("g").u32(0xFFFFFFFFu).text("dev").bytes() << true
            << QStringList() << kVersion << account << 7u << QStringList { QStringLiteral("dev") } << QString();
        RecordFields zoned = fields;
        zoned.zone = "cipher";
        QTest::newRow("non-empty zone") << recordFile(zoned) << false << QStringList() << kVersion << account
                                        << fields.mainGid << groups << password;
        QTest::newRow("zone of nearly 4 GiB")
            << full.left(full.size() - 4 - 4 - fields.password.size() - 4) + RecordBytes().u32(0xFFFFFFF0u).bytes()
                + "x"
            << false << QStringList() << kVersion << account << fields.mainGid << groups << QString();
    }

    void readFromFile()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, expected);
        QFETCH(QStringList, warnings);
        QFETCH(quint32, version);
        QFETCH(QString, account);
        QFETCH(quint32, mainGid);
        QFETCH(QStringList, functionGroups);
        QFETCH(QString, password);

        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(writeBytes(path, content));
        const CacheControlPtr record = createCacheControl();
#if ALLOCATION_PROBE
        largestRequest = 0;
        probing = true;
#endif
        const bool ok = record->readFromFile(path);
#if ALLOCATION_PROBE
        probing = false;
        QVERIFY2(largestRequest < 1024 * 1024, qPrintable(QStringLiteral("largest allocation %1").arg(largestRequest)));
#endif
        QCOMPARE(ok, expected);
        QCOMPARE(::warnings(), warnings);
        QCOMPARE(record->storedVersion(), version);
        QCOMPARE(record->account(), account);
        QCOMPARE(record->mainGid(), mainGid);
        QCOMPARE(record->functionGroupList(), functionGroups);
        QCOMPARE(record->password(), password);
        QCOMPARE(record->verifyEncryptedZone(), record->encryptedZoneInfo().isEmpty());
    }

    void readFromMissingFile()
    {
        const QString path = m_root->workDir() + QStringLiteral("/404");
        const CacheControlPtr record = createCacheControl();
        QVERIFY(!record->readFromFile(path));
        QCOMPARE(warnings(), QStringList { path + QStringLiteral("is not exists !") });
    }

    void writeNeedsAVersion()
    {
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(!createCacheControl()->writeToFile(path));
        QVERIFY(!QFile::exists(path));
        QVERIFY(warnings().isEmpty());
    }

    void writeToUnopenablePath()
    {
        const QString path = m_root->workDir() + QStringLiteral("/missing/10001");
        QVERIFY(!filledRecord()->writeToFile(path));
        QCOMPARE(warnings(), QStringList { path + QStringLiteral("is not exists !") });
    }

    void writtenFileIsOwnerOnly_data()
    {
        QTest::addColumn<bool>("existing");
        QTest::newRow("new file") << false;
        QTest::newRow("existing world-readable file") << true;
    }

    void writtenFileIsOwnerOnly()
    {
        QFETCH(bool, existing);
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        if (existing) {
            QVERIFY(writeBytes(path, QByteArray(500, 'z')));
            QVERIFY(::chmod(QFile::encodeName(path).constData(), 0666) == 0);
        }
        const mode_t previousMask = ::umask(0);
        const bool written = filledRecord()->writeToFile(path);
        ::umask(previousMask);
        QVERIFY(written);
        struct stat status = {};
        QVERIFY(::stat(QFile::encodeName(path).constData(), &status) == 0);
        QCOMPARE(status.st_mode & 07777, mode_t(0600));
        QCOMPARE(readBytes(path).toHex(), recordFile(RecordFields()).toHex());
    }

    void countDecidesFileEntries_data()
    {
        QTest::addColumn<int>("count");
        QTest::addColumn<int>("fileEntries");
        QTest::newRow("fewer than listed") << 2 << 2;
        QTest::newRow("as listed") << 3 << 3;
        QTest::newRow("none") << 0 << 0;
        QTest::newRow("more than listed") << 5 << 3;
    }

    void countDecidesFileEntries()
    {
        QFETCH(int, count);
        QFETCH(int, fileEntries);
        const QList<QByteArray> groups { "dev", "ops", "qa" };

        QJsonObject json = jsonObjectOf(filledRecord()->toJsonString(QJsonDocument::Compact));
        json.insert(QStringLiteral("function_group_count"), count);
        json.insert(QStringLiteral("function_group_list"), QJsonArray::fromStringList(texts(groups)));
        const CacheControlPtr record = createCacheControl();
        QVERIFY(record->fromJsonString(QString::fromUtf8(QJsonDocument(json).toJson())));
        QCOMPARE(record->functionGroupCount(), quint32(count));

        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(record->writeToFile(path));
        RecordFields expected;
        expected.functionGroups = groups.mid(0, fileEntries);
        QCOMPARE(readBytes(path).toHex(), recordFile(expected).toHex());

        const QJsonObject written = jsonObjectOf(record->toJsonString(QJsonDocument::Compact));
        QCOMPARE(written.value(QStringLiteral("function_group_count")).toInt(), count);
        QCOMPARE(written.value(QStringLiteral("function_group_list")).toArray().size(), 3);
    }

    void jsonRoundTrip_data()
    {
        QTest::addColumn<bool>("indented");
        QTest::newRow("compact") << false;
        QTest::newRow("indented") << true;
    }

    void jsonRoundTrip()
    {
        QFETCH(bool, indented);
        const QJsonDocument::JsonFormat format = indented ? QJsonDocument::Indented : QJsonDocument::Compact;
        const CacheControlPtr original = filledRecord();
        original->setUid(4000000000u);
        original->setRemoveStatus(3);
        original->setAuxiliaryText(QStringLiteral("kept in memory only"));
        const QString json = original->toJsonString(format);
        QCOMPARE(json.contains(QLatin1Char('\n')), indented);

        const CacheControlPtr copy = createCacheControl();
        QVERIFY(copy->fromJsonString(json));
        QCOMPARE(copy->toJsonString(QJsonDocument::Compact), original->toJsonString(QJsonDocument::Compact));
        QCOMPARE(copy->uid(), 4000000000u);
        QCOMPARE(copy->removeStatus(), 3u);
        QCOMPARE(copy->account(), original->account());
        QCOMPARE(copy->functionGroupList(), original->functionGroupList());
        QCOMPARE(copy->otherGroupList(), original->otherGroupList());
        QCOMPARE(copy->lastLoginTime(), original->lastLoginTime());
        QCOMPARE(copy->cacheEffectiveSeconds(), original->cacheEffectiveSeconds());
        QCOMPARE(copy->password(), original->password());
        QVERIFY(copy->auxiliaryText().isEmpty());
        QCOMPARE(original->auxiliaryText(), QStringLiteral("kept in memory only"));
    }

    void jsonKeysAndTypes()
    {
        const CacheControlPtr record = filledRecord();
        record->setUid(4000000000u);
        const QJsonObject json = jsonObjectOf(record->toJsonString(QJsonDocument::Compact));
        QStringList keys = json.keys();
        keys.sort();
        QCOMPARE(keys,
            (QStringList { QStringLiteral("account"), QStringLiteral("cache_effective_seconds"),
                QStringLiteral("encrypted_zone_info"), QStringLiteral("function_group_count"),
                QStringLiteral("function_group_list"), QStringLiteral("gecos"), QStringLiteral("home_path"),
                QStringLiteral("last_login_time"), QStringLiteral("login_shell"), QStringLiteral("main_gid"),
                QStringLiteral("main_gid_name"), QStringLiteral("other_group_count"),
                QStringLiteral("other_group_list"), QStringLiteral("password"), QStringLiteral("plaintext_length"),
                QStringLiteral("remove_status"), QStringLiteral("secrettext_length"), QStringLiteral("uid"),
                QStringLiteral("version") }));
        // 32-bit fields travel as signed numbers.
        QCOMPARE(json.value(QStringLiteral("uid")).toDouble(), -294967296.0);
        QCOMPARE(json.value(QStringLiteral("version")).toDouble(), 16777216.0);
        QCOMPARE(json.value(QStringLiteral("last_login_time")).toDouble(), 1700000000.0);
        QCOMPARE(json.value(QStringLiteral("cache_effective_seconds")).toDouble(), 604800.0);
        QCOMPARE(json.value(QStringLiteral("function_group_list")).toArray(),
            QJsonArray::fromStringList({ QStringLiteral("dev"), QStringLiteral("ops") }));
        QCOMPARE(json.value(QStringLiteral("account")).toString(), QStringLiteral("@alice"));
        QVERIFY(json.value(QStringLiteral("encrypted_zone_info")).isString());
        QVERIFY(json.value(QStringLiteral("remove_status")).isDouble());
    }

    void toJsonStringClearsTheZone()
    {
        RecordFields zoned;
        zoned.zone = "cipher";
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(writeBytes(path, RecordBytes().u32(kVersion).u32(6).u32(9).bytes() + recordFile(zoned).mid(12)));
        const CacheControlPtr record = createCacheControl();
        QVERIFY(!record->readFromFile(path));
        QCOMPARE(record->encryptedZoneInfo(), QStringLiteral("cipher"));
        QCOMPARE(record->plaintextLength(), 6u);
        QCOMPARE(record->secrettextLength(), 9u);
        QVERIFY(!record->verifyEncryptedZone());

        const QJsonObject json = jsonObjectOf(record->toJsonString(QJsonDocument::Compact));
        QCOMPARE(json.value(QStringLiteral("encrypted_zone_info")).toString(), QString());
        QCOMPARE(json.value(QStringLiteral("plaintext_length")).toInt(-1), 0);
        QCOMPARE(json.value(QStringLiteral("secrettext_length")).toInt(-1), 0);
        QVERIFY(record->encryptedZoneInfo().isEmpty());
        QCOMPARE(record->plaintextLength(), 0u);
        QCOMPARE(record->secrettextLength(), 0u);
        QVERIFY(record->verifyEncryptedZone());
    }

    void writeToFileClearsTheZone()
    {
        RecordFields zoned;
        zoned.zone = "cipher";
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        QVERIFY(writeBytes(path, recordFile(zoned)));
        const CacheControlPtr record = createCacheControl();
        QVERIFY(!record->readFromFile(path));
        QVERIFY(record->writeToFile(path));
        QVERIFY(record->verifyEncryptedZone());
        QCOMPARE(readBytes(path).toHex(), recordFile(RecordFields()).toHex());
    }

    void fromJsonIgnoresTheZone()
    {
        QJsonObject json = jsonObjectOf(filledRecord()->toJsonString(QJsonDocument::Compact));
        json.insert(QStringLiteral("encrypted_zone_info"), QStringLiteral("cipher"));
        json.insert(QStringLiteral("plaintext_length"), 6);
        json.insert(QStringLiteral("secrettext_length"), 9);
        const CacheControlPtr record = createCacheControl();
        QVERIFY(record->fromJsonString(QString::fromUtf8(QJsonDocument(json).toJson())));
        QVERIFY(record->encryptedZoneInfo().isEmpty());
        QVERIFY(record->verifyEncryptedZone());
        QCOMPARE(record->plaintextLength(), 6u);
        QCOMPARE(record->secrettextLength(), 9u);
    }

    void fromJsonStringRefuses_data()
    {
        QTest::addColumn<QString>("json");
        QTest::addColumn<QString>("warning");
        QTest::newRow("array") << QStringLiteral("[1, 2]") << QStringLiteral("json is not an object !!!");
        QTest::newRow("opening brace alone") << QStringLiteral("{") << QStringLiteral("fromJsonString error : ");
        QTest::newRow("half an object") << QStringLiteral("{\"version\": 16777216, \"uid\": ")
                                        << QStringLiteral("fromJsonString error : ");
        QTest::newRow("empty text") << QString() << QStringLiteral("fromJsonString error : ");
    }

    void fromJsonStringRefuses()
    {
        QFETCH(QString, json);
        QFETCH(QString, warning);
        const CacheControlPtr record = filledRecord();
        const QString before = record->toJsonString(QJsonDocument::Compact);
        QVERIFY(!record->fromJsonString(json));
        const QStringList logged = warnings();
        QCOMPARE(logged.size(), 1);
        if (warning.endsWith(QLatin1String(": "))) {
            QVERIFY2(logged.first().startsWith(warning), qPrintable(logged.first()));
            QVERIFY(logged.first().size() > warning.size());
        } else {
            QCOMPARE(logged.first(), warning);
        }
        QCOMPARE(record->toJsonString(QJsonDocument::Compact), before);
    }

    void fromEmptyObjectResetsEveryField()
    {
        const CacheControlPtr record = filledRecord();
        QVERIFY(record->fromJsonString(QStringLiteral("{}")));
        QCOMPARE(record->storedVersion(), 0u);
        QCOMPARE(record->uid(), 0u);
        QVERIFY(record->account().isEmpty());
        QCOMPARE(record->mainGid(), 0u);
        QVERIFY(record->mainGidName().isEmpty());
        QCOMPARE(record->functionGroupCount(), 0u);
        QVERIFY(record->functionGroupList().isEmpty());
        QCOMPARE(record->otherGroupCount(), 0u);
        QVERIFY(record->otherGroupList().isEmpty());
        QVERIFY(record->gecos().isEmpty());
        QVERIFY(record->homePath().isEmpty());
        QVERIFY(record->loginShell().isEmpty());
        QCOMPARE(record->cacheEffectiveSeconds(), Q_UINT64_C(0));
        QCOMPARE(record->lastLoginTime(), Q_UINT64_C(0));
        QVERIFY(record->password().isEmpty());
        QCOMPARE(record->removeStatus(), 0u);
        QVERIFY(warnings().isEmpty());
    }

    void jsonTimes_data()
    {
        QTest::addColumn<QString>("value");
        QTest::addColumn<quint64>("expected");
        QTest::newRow("whole") << QStringLiteral("1700000000") << Q_UINT64_C(1700000000);
        QTest::newRow("fraction truncated") << QStringLiteral("1.9") << Q_UINT64_C(1);
        QTest::newRow("negative") << QStringLiteral("-5") << Q_UINT64_C(0);
        QTest::newRow("text") << QStringLiteral("\"12\"") << Q_UINT64_C(0);
        QTest::newRow("beyond 64 bits") << QStringLiteral("1e300") << std::numeric_limits<quint64>::max();
        QTest::newRow("2^53") << QStringLiteral("9007199254740992") << Q_UINT64_C(9007199254740992);
    }

    void jsonTimes()
    {
        QFETCH(QString, value);
        QFETCH(quint64, expected);
        const CacheControlPtr record = createCacheControl();
        QVERIFY(record->fromJsonString(
            QStringLiteral("{\"last_login_time\": %1, \"cache_effective_seconds\": %1}").arg(value)));
        QCOMPARE(record->lastLoginTime(), expected);
        QCOMPARE(record->cacheEffectiveSeconds(), expected);
    }

    void factory_data()
    {
        QTest::addColumn<quint32>("version");
        QTest::addColumn<bool>("created");
        QTest::newRow("1.0") << kVersion << true;
        QTest::newRow("zero") << 0u << false;
        QTest::newRow("1.0 plus one") << 0x01000001u << false;
        QTest::newRow("two") << 2u << false;
        QTest::newRow("byte-swapped 1.0") << 0x00000001u << false;
    }

    void factory()
    {
        QFETCH(quint32, version);
        QFETCH(bool, created);
        const CacheControlPtr record = createCacheControl(version);
        QCOMPARE(!record.isNull(), created);
        if (!record)
            return;
        QCOMPARE(record->version(), kVersion);
        QCOMPARE(record->storedVersion(), 0u);
        QVERIFY(record->account().isEmpty());
    }

    void cacheVersionOfJson_data()
    {
        QTest::addColumn<QString>("json");
        QTest::addColumn<quint32>("expected");
        QTest::newRow("1.0") << QStringLiteral("{\"version\": 16777216, \"uid\": 5}") << kVersion;
        QTest::newRow("two") << QStringLiteral("{\"version\": 2}") << 0u;
        QTest::newRow("1.0 plus one") << QStringLiteral("{\"version\": 16777217}") << 0u;
        QTest::newRow("absent") << QStringLiteral("{\"uid\": 5}") << 0u;
        QTest::newRow("as text") << QStringLiteral("{\"version\": \"16777216\"}") << 0u;
        QTest::newRow("not whole") << QStringLiteral("{\"version\": 16777216.5}") << 0u;
        QTest::newRow("array") << QStringLiteral("[16777216]") << 0u;
        QTest::newRow("broken") << QStringLiteral("{\"version\": 16777216") << 0u;
    }

    void cacheVersionOfJson()
    {
        QFETCH(QString, json);
        QFETCH(quint32, expected);
        QCOMPARE(::cacheVersionOfJson(json), expected);
    }

    void cacheVersionOfFile_data()
    {
        QTest::addColumn<QByteArray>("content");
        QTest::addColumn<bool>("exists");
        QTest::addColumn<quint32>("expected");
        QTest::newRow("version only") << QByteArray::fromHex("00000001") << true << kVersion;
        QTest::newRow("whole record") << recordFile(RecordFields()) << true << kVersion;
        QTest::newRow("three bytes") << QByteArray::fromHex("000000") << true << 0u;
        QTest::newRow("big-endian") << QByteArray::fromHex("01000000") << true << 0u;
        QTest::newRow("1.0 plus one") << QByteArray::fromHex("01000001") << true << 0u;
        QTest::newRow("missing") << QByteArray() << false << 0u;
    }

    void cacheVersionOfFile()
    {
        QFETCH(QByteArray, content);
        QFETCH(bool, exists);
        QFETCH(quint32, expected);
        const QString path = m_root->workDir() + QStringLiteral("/10001");
        if (exists)
            QVERIFY(writeBytes(path, content));
        QCOMPARE(::cacheVersionOfFile(path), expected);
    }

    void cacheValiditySeconds_data()
    {
        QTest::addColumn<QByteArray>("ini");
        QTest::addColumn<quint32>("expected");
        QTest::newRow("no settings file") << QByteArray() << 0u;
        QTest::newRow("key absent") << QByteArray("[offline_login]\nenable=true\n") << 0u;
        QTest::newRow("key in another group") << QByteArray("[main]\ncache_validity=3\n") << 0u;
        QTest::newRow("zero") << QByteArray("[offline_login]\ncache_validity=0\n") << 0u;
        QTest::newRow("two days") << QByteArray("[offline_login]\ncache_validity=2\n") << 172800u;
        QTest::newRow("seven days") << QByteArray("[offline_login]\ncache_validity=7\n") << 604800u;
        QTest::newRow("not a number") << QByteArray("[offline_login]\ncache_validity=abc\n") << 0u;
        QTest::newRow("negative") << QByteArray("[offline_login]\ncache_validity=-1\n") << 0u;
        QTest::newRow("largest without wrap") << QByteArray("[offline_login]\ncache_validity=49710\n") << 4294944000u;
        QTest::newRow("first wrap") << QByteArray("[offline_login]\ncache_validity=49711\n") << 63104u;
        QTest::newRow("largest day count") << QByteArray("[offline_login]\ncache_validity=4294967295\n") << 4294880896u;
    }

    void cacheValiditySeconds()
    {
        QFETCH(QByteArray, ini);
        QFETCH(quint32, expected);
        if (!ini.isNull())
            QVERIFY(m_root->writeSettings(ini));
        QCOMPARE(::cacheValiditySeconds(), expected);
    }

    void isCacheEffective_data()
    {
        QTest::addColumn<QByteArray>("ini");
        QTest::addColumn<qint64>("age"); // seconds between the last login and now
        QTest::addColumn<bool>("expected");
        const QByteArray week("[offline_login]\ncache_validity=7\n");
        const QByteArray none("[offline_login]\ncache_validity=0\n");
        const QByteArray wrapped("[offline_login]\ncache_validity=49711\n");
        QTest::newRow("exactly seven days") << week << qint64(604800) << true;
        QTest::newRow("seven days and a second") << week << qint64(604801) << false;
        QTest::newRow("one day") << week << qint64(86400) << true;
        QTest::newRow("no validity, same second") << none << qint64(0) << true;
        QTest::newRow("no validity, a second ago") << none << qint64(1) << false;
        QTest::newRow("no validity, in the future") << none << qint64(-100) << true;
        QTest::newRow("no settings, same second") << QByteArray() << qint64(0) << true;
        QTest::newRow("no settings, a second ago") << QByteArray() << qint64(1) << false;
        QTest::newRow("wrapped validity, inside") << wrapped << qint64(63104) << true;
        QTest::newRow("wrapped validity, outside") << wrapped << qint64(63105) << false;
    }

    void isCacheEffective()
    {
        QFETCH(QByteArray, ini);
        QFETCH(qint64, age);
        QFETCH(bool, expected);
        if (!ini.isNull())
            QVERIFY(m_root->writeSettings(ini));
        const CacheControlPtr record = filledRecord();
        // The stored period plays no part.
        record->setCacheEffectiveSeconds(Q_UINT64_C(1) << 40);
        const int result = atSteadySecond([&](qint64 now) {
            record->setLastLoginTime(quint64(now - age));
            return record->isCacheEffective();
        });
        QCOMPARE(result, expected ? 1 : 0);
    }

    void neverLoggedInIsNotEffective()
    {
        QVERIFY(m_root->writeSettings("[offline_login]\ncache_validity=7\n"));
        const CacheControlPtr record = filledRecord();
        record->setLastLoginTime(0);
        QVERIFY(!record->isCacheEffective());
    }

private:
    QScopedPointer<TestRoot> m_root;
};

QTEST_GUILESS_MAIN(CacheRecordTest)
#include "test_cacherecord.moc"
