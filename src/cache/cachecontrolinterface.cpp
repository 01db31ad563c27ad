#include "cachecontrolinterface.h"

#include <QByteArray>
#include <QDataStream>
#include <QIODevice>
#include <QtEndian>

namespace
{
// Strings are read piecewise so an announced length never turns into one allocation of that size.
constexpr qint64 kReadChunk = 64 * 1024;
// QByteArray cannot grow much past this; no real record comes near it.
constexpr qint64 kStringLimit = 1 << 30;

template<typename T> bool readInteger(QDataStream &stream, T &value)
{
    value = 0;
    uchar bytes[sizeof(T)] = {};
    const int got = stream.readRawData(reinterpret_cast<char *>(bytes), int(sizeof(T)));
    value = qFromLittleEndian<T>(bytes);
    return got == int(sizeof(T));
}

template<typename T> bool writeInteger(QDataStream &stream, T value)
{
    uchar bytes[sizeof(T)];
    qToLittleEndian<T>(value, bytes);
    return stream.writeRawData(reinterpret_cast<const char *>(bytes), int(sizeof(T))) == int(sizeof(T));
}

// How much of the rest of the string may be read in one step without trusting the announced length.
qint64 nextChunk(const QIODevice *device, qint64 remaining, qint64 alreadyRead)
{
    qint64 chunk = qMin(remaining, kReadChunk);
    if (!device->isSequential())
        chunk = qMin(chunk, device->bytesAvailable());
    return qMin(chunk, kStringLimit - alreadyRead);
}
} // namespace

CacheControlInterface::~CacheControlInterface() = default;

bool CacheControlInterface::readUInt32(QDataStream &stream, quint32 &value) const
{
    return readInteger(stream, value);
}

bool CacheControlInterface::writeUInt32(QDataStream &stream, quint32 value) const
{
    return writeInteger(stream, value);
}

bool CacheControlInterface::readUInt64(QDataStream &stream, quint64 &value) const
{
    return readInteger(stream, value);
}

bool CacheControlInterface::writeUInt64(QDataStream &stream, quint64 value) const
{
    return writeInteger(stream, value);
}

bool CacheControlInterface::readString(QDataStream &stream, quint32 length, QString &text) const
{
    text.clear();
    const QIODevice *device = stream.device();
    if (!device)
        return false;
    QByteArray bytes;
    qint64 remaining = length;
    while (remaining > 0) {
        const qint64 chunk = nextChunk(device, remaining, bytes.size());
        if (chunk <= 0)
            break;
        const int start = bytes.size();
        bytes.resize(start + int(chunk));
        const int got = stream.readRawData(bytes.data() + start, int(chunk));
        if (got < 0)
            return false;
        bytes.resize(start + got);
        remaining -= got;
        if (got < chunk)
            break;
    }
    const int zero = bytes.indexOf('\0');
    text = QString::fromUtf8(zero < 0 ? bytes : bytes.left(zero));
    return remaining == 0;
}

bool CacheControlInterface::writeString(QDataStream &stream, const QString &text) const
{
    const QByteArray bytes = text.toUtf8();
    const bool countWritten = writeUInt32(stream, quint32(bytes.size()));
    if (bytes.isEmpty())
        return countWritten;
    return stream.writeRawData(bytes.constData(), bytes.size()) == bytes.size() && countWritten;
}
