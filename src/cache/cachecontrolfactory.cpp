#include "cachecontrolfactory.h"

#include "cachecontrol_1_0.h"
#include "settingsfile.h"

#include <QIODevice>
#include <QJsonObject>
#include <QtEndian>

namespace
{
constexpr quint32 kSecondsPerDay = 86400;
} // namespace

CacheControlPtr createCacheControl()
{
    return CacheControlPtr(new CacheControl_1_0);
}

CacheControlPtr createCacheControl(quint32 version)
{
    if (version != kCacheVersion1_0)
        return CacheControlPtr();
    return createCacheControl();
}

quint32 cacheVersionOfJson(const QString &json)
{
    const QJsonDocument document = QJsonDocument::fromJson(json.toUtf8());
    if (!document.isObject())
        return 0;
    const int version = document.object().value(QStringLiteral("version")).toInt();
    return quint32(version) == kCacheVersion1_0 ? kCacheVersion1_0 : 0;
}

quint32 cacheVersionOfDevice(QIODevice &device)
{
    uchar bytes[4];
    if (device.peek(reinterpret_cast<char *>(bytes), sizeof(bytes)) != qint64(sizeof(bytes)))
        return 0;
    return qFromLittleEndian<quint32>(bytes) == kCacheVersion1_0 ? kCacheVersion1_0 : 0;
}

quint32 cacheValiditySeconds()
{
    const quint32 days
        = SettingsFile::value(QStringLiteral("offline_login"), QStringLiteral("cache_validity"), 0u).toUInt();
    // Wraps above 49710 days on purpose.
    return days * kSecondsPerDay;
}
