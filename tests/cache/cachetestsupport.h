#pragma once

#include "syslogcapture.h"

#include <QByteArray>
#include <QDateTime>
#include <QFile>
#include <QRegularExpression>
#include <QStringList>

#include <functional>

// Builds a record file byte by byte, independently of the code under test: little-endian integers,
// strings as a 32-bit byte count and the UTF-8 bytes.
class RecordBytes
{
public:
    RecordBytes &u32(quint32 value)
    {
        for (int shift = 0; shift < 32; shift += 8)
            m_data.append(char((value >> shift) & 0xff));
        return *this;
    }
    RecordBytes &u64(quint64 value)
    {
        for (int shift = 0; shift < 64; shift += 8)
            m_data.append(char((value >> shift) & 0xff));
        return *this;
    }
    RecordBytes &text(const QByteArray &utf8)
    {
        u32(quint32(utf8.size()));
        m_data.append(utf8);
        return *this;
    }
    RecordBytes &raw(const QByteArray &bytes)
    {
        m_data.append(bytes);
        return *this;
    }
    QByteArray bytes() const { return m_data; }

private:
    QByteArray m_data;
};

struct RecordFields {
    quint32 uid = 10001;
    QByteArray account = "@alice";
    quint32 mainGid = 10001;
    QByteArray mainGidName = "alice";
    QList<QByteArray> functionGroups { "dev", "ops" };
    QList<QByteArray> otherGroups { "wheel" };
    QByteArray gecos = "Alice \xc3\x84. Example";
    QByteArray homePath = "/home/remote/alice";
    QByteArray loginShell = "/bin/bash";
    quint64 cacheEffectiveSeconds = 604800;
    quint64 lastLoginTime = 1700000000;
    QByteArray zone;
    QByteArray password = "5e884898da28047151d0e56f8dc6292773603d0d6aabbdd62a11ef721d1542d8";
    quint32 removeStatus = 0;
};

inline QStringList texts(const QList<QByteArray> &utf8)
{
    QStringList result;
    for (const QByteArray &item : utf8)
        result.append(QString::fromUtf8(item));
    return result;
}

inline QByteArray recordFile(const RecordFields &fields, quint32 version = 0x01000000)
{
    RecordBytes bytes;
    bytes.u32(version).u32(0).u32(0).u32(fields.uid).text(fields.account);
    bytes.u32(fields.mainGid).text(fields.mainGidName);
    bytes.u32(quint32(fields.functionGroups.size()));
    for (const QByteArray &group : fields.functionGroups)
        bytes.text(group);
    bytes.u32(quint32(fields.otherGroups.size()));
    for (const QByteArray &group : fields.otherGroups)
        bytes.text(group);
    bytes.text(fields.gecos).text(fields.homePath).text(fields.loginShell);
    bytes.u64(fields.cacheEffectiveSeconds).u64(fields.lastLoginTime);
    bytes.text(fields.zone).text(fields.password).u32(fields.removeStatus);
    return bytes.bytes();
}

inline bool writeBytes(const QString &path, const QByteArray &bytes)
{
    QFile file(path);
    return file.open(QIODevice::WriteOnly | QIODevice::Truncate) && file.write(bytes) == bytes.size() && file.flush();
}

inline QByteArray readBytes(const QString &path)
{
    QFile file(path);
    return file.open(QIODevice::ReadOnly) ? file.readAll() : QByteArray();
}

// Logged messages of one priority without the "cpu time: N, " prefix, in order.
inline QStringList loggedTexts(int priority)
{
    static const QRegularExpression prefix(QStringLiteral("^cpu time: \\d+, "));
    QStringList texts;
    const QList<SyslogLine> lines = SyslogCapture::lines();
    for (const SyslogLine &line : lines) {
        if (line.priority == priority)
            texts.append(QString::fromUtf8(line.text).remove(prefix));
    }
    return texts;
}

inline QStringList warnings()
{
    return loggedTexts(4);
}

// Runs a check that depends on the current second, given that second. Repeats when the clock moved
// on to the next second meanwhile; -1 when it never held still.
inline int atSteadySecond(const std::function<bool(qint64 now)> &check)
{
    for (int attempt = 0; attempt < 10; ++attempt) {
        SyslogCapture::clear();
        const qint64 now = QDateTime::currentSecsSinceEpoch();
        const bool result = check(now);
        if (QDateTime::currentSecsSinceEpoch() == now)
            return result ? 1 : 0;
    }
    return -1;
}
