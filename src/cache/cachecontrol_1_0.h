#pragma once

#include "cachecontrolinterface.h"

class QJsonObject;

// Cache record of format version 1.0: the encrypted zone is always empty and the password a plain field.
class CacheControl_1_0 : public CacheControlInterface
{
public:
    CacheControl_1_0() = default;
    ~CacheControl_1_0() override;

    bool writeToFile(const QString &path) override;
    bool readFromFile(const QString &path) override;
    bool readFromDevice(QIODevice &device) override;
    quint32 version() const override;
    bool verifyEncryptedZone() const override;
    bool isCacheEffective() const override;
    void setAuxiliaryText(const QString &text) override;
    bool fromJsonString(const QString &json) override;
    QString toJsonString(QJsonDocument::JsonFormat format) override;
    void setUid(quint32 uid) override;
    quint32 uid() const override;
    quint32 mainGid() const override;
    QString account() const override;
    QString homePath() const override;
    QString loginShell() const override;
    QString gecos() const override;
    QString password() const override;
    quint32 removeStatus() const override;
    void setRemoveStatus(quint32 status) override;

    void setVersion(quint32 version) override;
    quint32 storedVersion() const override;
    quint32 plaintextLength() const override;
    quint32 secrettextLength() const override;
    QString encryptedZoneInfo() const override;
    void setAccount(const QString &account) override;
    void setMainGid(quint32 gid) override;
    QString mainGidName() const override;
    void setMainGidName(const QString &name) override;
    quint32 functionGroupCount() const override;
    QStringList functionGroupList() const override;
    void setFunctionGroupList(const QStringList &groups) override;
    quint32 otherGroupCount() const override;
    QStringList otherGroupList() const override;
    void setOtherGroupList(const QStringList &groups) override;
    void setGecos(const QString &gecos) override;
    void setHomePath(const QString &path) override;
    void setLoginShell(const QString &shell) override;
    void setPassword(const QString &password) override;
    quint64 cacheEffectiveSeconds() const override;
    void setCacheEffectiveSeconds(quint64 seconds) override;
    quint64 lastLoginTime() const override;
    void setLastLoginTime(quint64 seconds) override;
    QString auxiliaryText() const override;

private:
    QString computeEncryptedZone() const;
    void recomputeEncryptedZone();
    void writeFields(QDataStream &stream) const;
    void writeList(QDataStream &stream, quint32 count, const QStringList &list) const;
    void readFields(QDataStream &stream);
    bool readText(QDataStream &stream, QString &text) const;
    void readList(QDataStream &stream, quint32 &count, QStringList &list) const;
    void readJsonObject(const QJsonObject &object);

    quint32 m_version = 0;
    quint32 m_plaintextLength = 0;
    quint32 m_secrettextLength = 0;
    quint32 m_uid = 0;
    QString m_account;
    quint32 m_mainGid = 0;
    QString m_mainGidName;
    quint32 m_functionGroupCount = 0;
    QStringList m_functionGroupList;
    quint32 m_otherGroupCount = 0;
    QStringList m_otherGroupList;
    QString m_gecos;
    QString m_homePath;
    QString m_loginShell;
    quint64 m_cacheEffectiveSeconds = 0;
    quint64 m_lastLoginTime = 0;
    QString m_encryptedZoneInfo;
    QString m_password;
    quint32 m_removeStatus = 0;
    QString m_auxiliaryText;
};
