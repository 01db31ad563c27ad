#pragma once

#include <QJsonDocument>
#include <QSharedPointer>
#include <QString>
#include <QStringList>

class QDataStream;
class QIODevice;

// Format version 1.0 of a cache record (major version in the high byte).
constexpr quint32 kCacheVersion1_0 = 0x01000000;

// One network account's cached identity, groups, password item and login state.
class CacheControlInterface
{
public:
    CacheControlInterface() = default;
    virtual ~CacheControlInterface();
    CacheControlInterface(const CacheControlInterface &) = delete;
    CacheControlInterface &operator=(const CacheControlInterface &) = delete;

    // Output recomputes the encrypted zone, hence the non-const writers.
    virtual bool writeToFile(const QString &path) = 0;
    virtual bool readFromFile(const QString &path) = 0;
    // As readFromFile, from a file already open at its start.
    virtual bool readFromDevice(QIODevice &device) = 0;
    // The format version of the class, not the stored field (see storedVersion()).
    virtual quint32 version() const = 0;
    virtual bool verifyEncryptedZone() const = 0;
    virtual bool isCacheEffective() const = 0;
    virtual void setAuxiliaryText(const QString &text) = 0;
    virtual bool fromJsonString(const QString &json) = 0;
    virtual QString toJsonString(QJsonDocument::JsonFormat format) = 0;
    virtual void setUid(quint32 uid) = 0;
    virtual quint32 uid() const = 0;
    virtual quint32 mainGid() const = 0;
    virtual QString account() const = 0;
    virtual QString homePath() const = 0;
    virtual QString loginShell() const = 0;
    virtual QString gecos() const = 0;
    virtual QString password() const = 0;
    virtual quint32 removeStatus() const = 0;
    virtual void setRemoveStatus(quint32 status) = 0;

    // Raw little-endian integers and length-prefixed UTF-8 strings of the binary form.
    virtual bool readUInt32(QDataStream &stream, quint32 &value) const;
    virtual bool writeUInt32(QDataStream &stream, quint32 value) const;
    virtual bool readUInt64(QDataStream &stream, quint64 &value) const;
    virtual bool writeUInt64(QDataStream &stream, quint64 value) const;
    virtual bool readString(QDataStream &stream, quint32 length, QString &text) const;
    virtual bool writeString(QDataStream &stream, const QString &text) const;

    // Plain access for the code that fills records field by field.
    virtual void setVersion(quint32 version) = 0;
    virtual quint32 storedVersion() const = 0;
    virtual quint32 plaintextLength() const = 0;
    virtual quint32 secrettextLength() const = 0;
    virtual QString encryptedZoneInfo() const = 0;
    virtual void setAccount(const QString &account) = 0;
    virtual void setMainGid(quint32 gid) = 0;
    virtual QString mainGidName() const = 0;
    virtual void setMainGidName(const QString &name) = 0;
    virtual quint32 functionGroupCount() const = 0;
    virtual QStringList functionGroupList() const = 0;
    // Sets the list and its count together.
    virtual void setFunctionGroupList(const QStringList &groups) = 0;
    virtual quint32 otherGroupCount() const = 0;
    virtual QStringList otherGroupList() const = 0;
    // Sets the list and its count together.
    virtual void setOtherGroupList(const QStringList &groups) = 0;
    virtual void setGecos(const QString &gecos) = 0;
    virtual void setHomePath(const QString &path) = 0;
    virtual void setLoginShell(const QString &shell) = 0;
    virtual void setPassword(const QString &password) = 0;
    virtual quint64 cacheEffectiveSeconds() const = 0;
    virtual void setCacheEffectiveSeconds(quint64 seconds) = 0;
    virtual quint64 lastLoginTime() const = 0;
    virtual void setLastLoginTime(quint64 seconds) = 0;
    virtual QString auxiliaryText() const = 0;
};

using CacheControlPtr = QSharedPointer<CacheControlInterface>;
