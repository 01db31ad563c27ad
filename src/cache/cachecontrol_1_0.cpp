#include "cachecontrol_1_0.h"

#include "cachecontrolfactory.h"
#include "wholefile.h"

#include <QBuffer>
#include <QDataStream>
#include <QDateTime>
#include <QDebug>
#include <QFile>
#include <QJsonArray>
#include <QJsonObject>

#include <limits>

namespace
{
const QString kVersion = QStringLiteral("version");
const QString kPlaintextLength = QStringLiteral("plaintext_length");
const QString kSecrettextLength = QStringLiteral("secrettext_length");
const QString kUid = QStringLiteral("uid");
const QString kAccount = QStringLiteral("account");
const QString kMainGid = QStringLiteral("main_gid");
const QString kMainGidName = QStringLiteral("main_gid_name");
const QString kFunctionGroupCount = QStringLiteral("function_group_count");
const QString kFunctionGroupList = QStringLiteral("function_group_list");
const QString kOtherGroupCount = QStringLiteral("other_group_count");
const QString kOtherGroupList = QStringLiteral("other_group_list");
const QString kGecos = QStringLiteral("gecos");
const QString kHomePath = QStringLiteral("home_path");
const QString kLoginShell = QStringLiteral("login_shell");
const QString kCacheEffectiveSeconds = QStringLiteral("cache_effective_seconds");
const QString kLastLoginTime = QStringLiteral("last_login_time");
const QString kEncryptedZoneInfo = QStringLiteral("encrypted_zone_info");
const QString kPassword = QStringLiteral("password");
const QString kRemoveStatus = QStringLiteral("remove_status");

// Version 1.0 has no cipher: the zone's plaintext and ciphertext are both empty.
QByteArray zonePlaintext()
{
    return QByteArray();
}

QByteArray zoneCiphertext()
{
    return QByteArray();
}

QStringList textsOf(const QJsonValue &value)
{
    QStringList texts;
    const QJsonArray array = value.toArray();
    for (const QJsonValue &element : array)
        texts.append(element.toString());
    return texts;
}

quint32 uint32Of(const QJsonValue &value)
{
    return quint32(value.toInt());
}

// Truncates toward zero; negative numbers give 0 and numbers beyond the range saturate.
quint64 uint64Of(const QJsonValue &value)
{
    const double number = value.toDouble(0.0);
    if (!(number > 0.0))
        return 0;
    if (number >= 18446744073709551616.0)
        return std::numeric_limits<quint64>::max();
    return quint64(number);
}

void warnNotExists(const QString &path)
{
    qWarning().noquote() << path + QStringLiteral("is not exists !");
}
} // namespace

CacheControl_1_0::~CacheControl_1_0() = default;

bool CacheControl_1_0::writeToFile(const QString &path)
{
    if (m_version == 0)
        return false;
    recomputeEncryptedZone();
    QByteArray content;
    QBuffer buffer(&content);
    buffer.open(QIODevice::WriteOnly);
    QDataStream stream(&buffer);
    writeFields(stream);
    buffer.close();
    // The file holds the password item: owner read/write only.
    QString error;
    return WholeFile::write(path, content, QFileDevice::ReadOwner | QFileDevice::WriteOwner, error);
}

bool CacheControl_1_0::readFromFile(const QString &path)
{
    QFile file(path);
    if (!file.open(QIODevice::ReadOnly)) {
        warnNotExists(path);
        return false;
    }
    return readFromDevice(file);
}

bool CacheControl_1_0::readFromDevice(QIODevice &device)
{
    QDataStream stream(&device);
    readUInt32(stream, m_version);
    if (m_version != kCacheVersion1_0) {
        qWarning().noquote() << QStringLiteral("version ") + QString::number(m_version) + QStringLiteral(" error");
        return false;
    }
    readFields(stream);
    return verifyEncryptedZone();
}

quint32 CacheControl_1_0::version() const
{
    return kCacheVersion1_0;
}

bool CacheControl_1_0::verifyEncryptedZone() const
{
    return m_encryptedZoneInfo == computeEncryptedZone();
}

bool CacheControl_1_0::isCacheEffective() const
{
    const quint64 now = quint64(QDateTime::currentSecsSinceEpoch());
    return m_lastLoginTime + quint64(cacheValiditySeconds()) >= now;
}

void CacheControl_1_0::setAuxiliaryText(const QString &text)
{
    m_auxiliaryText = text;
}

bool CacheControl_1_0::fromJsonString(const QString &json)
{
    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(json.toUtf8(), &error);
    if (error.error != QJsonParseError::NoError) {
        qWarning().noquote() << QStringLiteral("fromJsonString error : ") + error.errorString();
        return false;
    }
    if (!document.isObject()) {
        qWarning().noquote() << QStringLiteral("json is not an object !!!");
        return false;
    }
    readJsonObject(document.object());
    return true;
}

QString CacheControl_1_0::toJsonString(QJsonDocument::JsonFormat format)
{
    recomputeEncryptedZone();
    QJsonObject object;
    object.insert(kVersion, qint32(m_version));
    object.insert(kSecrettextLength, qint32(m_secrettextLength));
    object.insert(kPlaintextLength, qint32(m_plaintextLength));
    object.insert(kUid, qint32(m_uid));
    object.insert(kAccount, m_account);
    object.insert(kMainGid, qint32(m_mainGid));
    object.insert(kMainGidName, m_mainGidName);
    object.insert(kFunctionGroupCount, qint32(m_functionGroupCount));
    object.insert(kFunctionGroupList, QJsonArray::fromStringList(m_functionGroupList));
    object.insert(kOtherGroupCount, qint32(m_otherGroupCount));
    object.insert(kOtherGroupList, QJsonArray::fromStringList(m_otherGroupList));
    object.insert(kGecos, m_gecos);
    object.insert(kHomePath, m_homePath);
    object.insert(kLoginShell, m_loginShell);
    object.insert(kCacheEffectiveSeconds, double(m_cacheEffectiveSeconds));
    object.insert(kLastLoginTime, double(m_lastLoginTime));
    object.insert(kEncryptedZoneInfo, m_encryptedZoneInfo);
    object.insert(kPassword, m_password);
    object.insert(kRemoveStatus, qint32(m_removeStatus));
    return QString::fromUtf8(QJsonDocument(object).toJson(format));
}

void CacheControl_1_0::setUid(quint32 uid)
{
    m_uid = uid;
}

quint32 CacheControl_1_0::uid() const
{
    return m_uid;
}

quint32 CacheControl_1_0::mainGid() const
{
    return m_mainGid;
}

QString CacheControl_1_0::account() const
{
    return m_account;
}

QString CacheControl_1_0::homePath() const
{
    return m_homePath;
}

QString CacheControl_1_0::loginShell() const
{
    return m_loginShell;
}

QString CacheControl_1_0::gecos() const
{
    return m_gecos;
}

QString CacheControl_1_0::password() const
{
    return m_password;
}

quint32 CacheControl_1_0::removeStatus() const
{
    return m_removeStatus;
}

void CacheControl_1_0::setRemoveStatus(quint32 status)
{
    m_removeStatus = status;
}

void CacheControl_1_0::setVersion(quint32 version)
{
    m_version = version;
}

quint32 CacheControl_1_0::storedVersion() const
{
    return m_version;
}

quint32 CacheControl_1_0::plaintextLength() const
{
    return m_plaintextLength;
}

quint32 CacheControl_1_0::secrettextLength() const
{
    return m_secrettextLength;
}

QString CacheControl_1_0::encryptedZoneInfo() const
{
    return m_encryptedZoneInfo;
}

void CacheControl_1_0::setAccount(const QString &account)
{
    m_account = account;
}

void CacheControl_1_0::setMainGid(quint32 gid)
{
    m_mainGid = gid;
}

QString CacheControl_1_0::mainGidName() const
{
    return m_mainGidName;
}

void CacheControl_1_0::setMainGidName(const QString &name)
{
    m_mainGidName = name;
}

quint32 CacheControl_1_0::functionGroupCount() const
{
    return m_functionGroupCount;
}

QStringList CacheControl_1_0::functionGroupList() const
{
    return m_functionGroupList;
}

void CacheControl_1_0::setFunctionGroupList(const QStringList &groups)
{
    m_functionGroupList = groups;
    m_functionGroupCount = quint32(groups.size());
}

quint32 CacheControl_1_0::otherGroupCount() const
{
    return m_otherGroupCount;
}

QStringList CacheControl_1_0::otherGroupList() const
{
    return m_otherGroupList;
}

void CacheControl_1_0::setOtherGroupList(const QStringList &groups)
{
    m_otherGroupList = groups;
    m_otherGroupCount = quint32(groups.size());
}

void CacheControl_1_0::setGecos(const QString &gecos)
{
    m_gecos = gecos;
}

void CacheControl_1_0::setHomePath(const QString &path)
{
    m_homePath = path;
}

void CacheControl_1_0::setLoginShell(const QString &shell)
{
    m_loginShell = shell;
}

void CacheControl_1_0::setPassword(const QString &password)
{
    m_password = password;
}

quint64 CacheControl_1_0::cacheEffectiveSeconds() const
{
    return m_cacheEffectiveSeconds;
}

void CacheControl_1_0::setCacheEffectiveSeconds(quint64 seconds)
{
    m_cacheEffectiveSeconds = seconds;
}

quint64 CacheControl_1_0::lastLoginTime() const
{
    return m_lastLoginTime;
}

void CacheControl_1_0::setLastLoginTime(quint64 seconds)
{
    m_lastLoginTime = seconds;
}

QString CacheControl_1_0::auxiliaryText() const
{
    return m_auxiliaryText;
}

QString CacheControl_1_0::computeEncryptedZone() const
{
    const QByteArray ciphertext = zoneCiphertext();
    return ciphertext.isNull() ? QString() : QString::fromUtf8(ciphertext);
}

void CacheControl_1_0::recomputeEncryptedZone()
{
    m_plaintextLength = quint32(zonePlaintext().size());
    m_secrettextLength = quint32(zoneCiphertext().size());
    m_encryptedZoneInfo = computeEncryptedZone();
}

void CacheControl_1_0::writeFields(QDataStream &stream) const
{
    writeUInt32(stream, m_version);
    writeUInt32(stream, m_plaintextLength);
    writeUInt32(stream, m_secrettextLength);
    writeUInt32(stream, m_uid);
    writeString(stream, m_account);
    writeUInt32(stream, m_mainGid);
    writeString(stream, m_mainGidName);
    writeList(stream, m_functionGroupCount, m_functionGroupList);
    writeList(stream, m_otherGroupCount, m_otherGroupList);
    writeString(stream, m_gecos);
    writeString(stream, m_homePath);
    writeString(stream, m_loginShell);
    writeUInt64(stream, m_cacheEffectiveSeconds);
    writeUInt64(stream, m_lastLoginTime);
    writeString(stream, m_encryptedZoneInfo);
    writeString(stream, m_password);
    writeUInt32(stream, m_removeStatus);
}

// The count decides how many entries go to the file. A count beyond the list has no entries to
// write, so the file then announces only the entries it really holds and stays readable.
void CacheControl_1_0::writeList(QDataStream &stream, quint32 count, const QStringList &list) const
{
    const quint32 written = qMin(count, quint32(list.size()));
    writeUInt32(stream, written);
    for (quint32 index = 0; index < written; ++index)
        writeString(stream, list.at(int(index)));
}

void CacheControl_1_0::readFields(QDataStream &stream)
{
    readUInt32(stream, m_plaintextLength);
    readUInt32(stream, m_secrettextLength);
    readUInt32(stream, m_uid);
    readText(stream, m_account);
    readUInt32(stream, m_mainGid);
    readText(stream, m_mainGidName);
    readList(stream, m_functionGroupCount, m_functionGroupList);
    readList(stream, m_otherGroupCount, m_otherGroupList);
    readText(stream, m_gecos);
    readText(stream, m_homePath);
    readText(stream, m_loginShell);
    readUInt64(stream, m_cacheEffectiveSeconds);
    readUInt64(stream, m_lastLoginTime);
    readText(stream, m_encryptedZoneInfo);
    readText(stream, m_password);
    readUInt32(stream, m_removeStatus);
}

bool CacheControl_1_0::readText(QDataStream &stream, QString &text) const
{
    quint32 length = 0;
    const bool lengthRead = readUInt32(stream, length);
    const bool textRead = readString(stream, length, text);
    return lengthRead && textRead;
}

// A count read from a damaged file may be anything up to 4 G: entries stop at the first one the
// file does not hold in full instead of filling the list with empty names.
void CacheControl_1_0::readList(QDataStream &stream, quint32 &count, QStringList &list) const
{
    readUInt32(stream, count);
    list.clear();
    for (quint32 index = 0; index < count; ++index) {
        QString entry;
        const bool complete = readText(stream, entry);
        if (complete || !entry.isEmpty())
            list.append(entry);
        if (!complete)
            return;
    }
}

void CacheControl_1_0::readJsonObject(const QJsonObject &object)
{
    m_version = uint32Of(object.value(kVersion));
    m_plaintextLength = uint32Of(object.value(kPlaintextLength));
    m_secrettextLength = uint32Of(object.value(kSecrettextLength));
    m_uid = uint32Of(object.value(kUid));
    m_account = object.value(kAccount).toString();
    m_mainGid = uint32Of(object.value(kMainGid));
    m_mainGidName = object.value(kMainGidName).toString();
    m_functionGroupCount = uint32Of(object.value(kFunctionGroupCount));
    m_functionGroupList = textsOf(object.value(kFunctionGroupList));
    m_otherGroupCount = uint32Of(object.value(kOtherGroupCount));
    m_otherGroupList = textsOf(object.value(kOtherGroupList));
    m_gecos = object.value(kGecos).toString();
    m_homePath = object.value(kHomePath).toString();
    m_loginShell = object.value(kLoginShell).toString();
    m_cacheEffectiveSeconds = uint64Of(object.value(kCacheEffectiveSeconds));
    m_lastLoginTime = uint64Of(object.value(kLastLoginTime));
    // The zone is never taken from outside; version 1.0 keeps it empty.
    m_encryptedZoneInfo = QString();
    m_password = object.value(kPassword).toString();
    m_removeStatus = uint32Of(object.value(kRemoveStatus));
}
