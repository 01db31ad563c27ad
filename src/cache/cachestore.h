#pragma once

#include "cachecontrolfactory.h"
#include "cachecontrolinterface.h"

#include <QList>
#include <QString>
#include <QStringList>

// One record file per network account in the working directory, named by the decimal uid.

QString cacheFilePath(const CacheControlInterface &record);
QString cacheFilePathOfUid(quint32 uid);
bool cacheFileExists(const CacheControlInterface &record);
// Writes the record to its file, owner read/write only. False for a record without a version.
bool saveCacheRecord(CacheControlInterface &record);
// Loads the file of the record's uid. When the file's format differs from the record's, the record is
// replaced by one of the file's format; a file of no known format leaves the caller with no record.
bool loadCacheRecord(CacheControlPtr &record);
// The record of a uid's file as it is now, shared and not to be changed; none for a file that is not a
// regular one or cannot be read.
CacheControlPtr readCacheRecord(quint32 uid);
// Fills the record from JSON, replacing it by one of the text's format when they differ; a text of no
// known format leaves the caller with no record.
bool cacheRecordFromJson(CacheControlPtr &record, const QString &json);
// The uid named by the last path component; 0 when it is not a number.
quint32 uidOfCacheFilePath(const QString &path);
QStringList listCacheFiles();
QList<quint32> listCacheUids();
// The file of knownUid, where the caller's user list has the account, is looked at before the whole store.
// found, when given, receives the record that was read to find the account (shared: not to be changed).
bool findCacheUidByAccount(
    const QString &account, quint32 &uid, quint32 knownUid = 0, CacheControlPtr *found = nullptr);
void removeCacheFile(quint32 uid);
void removeAllCacheFiles();
// Hands every domain user's record file to root, then deletes it.
void cleanDomainUserCacheFiles();
// Reads one user's record and writes it back; false when it cannot be read.
bool refreshCacheRecord(quint32 uid);
