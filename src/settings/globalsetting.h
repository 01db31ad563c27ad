#pragma once

#include <QString>

// Typed access to the settings file. Every getter re-reads the file so edits apply at the next call.
class GlobalSetting
{
public:
    virtual ~GlobalSetting();

    static GlobalSetting *instance();

    QString ip() const;
    QString serverAddress() const;
    QString entryption() const;
    QString domain() const;
    QString homeRoot() const;
    QString protocol() const;
    QString userUrl() const;
    QString resetPasswordUrl() const;
    QString groupUrl() const;
    QString authUrl() const;
    QString domainUrl() const;
    QString serverCert() const;
    QString privateKey() const;
    QString publicKey() const;
    int port() const;
    int networkTimeout() const;
    int networkFrequency() const;
    int dbusTimeout() const;
    int passwdLengthLimit() const;
    int passwdBufferLimit() const;
    int groupLengthLimit() const;
    int groupMemberCountLimit() const;
    int groupBufferLimit() const;
    bool isDebug() const;
    bool isEnabled() const;
    // Seconds an answer "no such account" from the domain server stands; 0 or less: not kept.
    int negativeCacheTimeout() const;

private:
    friend struct GlobalSettingOwner;
    GlobalSetting() = default;

    QString readString(const QString &group, const QString &key, const QString &defaultValue) const;
    int readInt(const QString &group, const QString &key, int defaultValue) const;
    bool readBool(const QString &group, const QString &key, bool defaultValue) const;
    QString readExistingPath(const QString &key, const QString &warning) const;
};
