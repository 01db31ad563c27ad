#pragma once

#include "testroot.h"

#include <cstdint>

// The fuzz targets' private system root, with the log dropped so that runs stay fast.
inline const TestRoot &fuzzRoot()
{
    static const TestRoot root;
    [[maybe_unused]] static const QtMessageHandler quiet
        = qInstallMessageHandler([](QtMsgType, const QMessageLogContext &, const QString &) {});
    return root;
}

// The fuzzer's input, not copied.
inline QByteArray fuzzInput(const uint8_t *data, size_t size)
{
    return QByteArray::fromRawData(reinterpret_cast<const char *>(data), int(size));
}
