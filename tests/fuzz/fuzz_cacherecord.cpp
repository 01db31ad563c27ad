// Fuzz target: the binary cache record read from a file, and its JSON form.
#include "cachecontrolfactory.h"
#include "cachecontrolinterface.h"
#include "fuzzroot.h"

#include <QJsonDocument>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    const TestRoot &root = fuzzRoot();
    const QString file = QStringLiteral("/var/lib/libkest-iam/10001");
    if (!root.writeFile(file, fuzzInput(data, size)))
        return 0;
    CacheControlPtr record = createCacheControl();
    if (record->readFromFile(root.filePath(file)))
        createCacheControl()->fromJsonString(record->toJsonString(QJsonDocument::Compact));
    createCacheControl()->fromJsonString(QString::fromUtf8(fuzzInput(data, size)));
    return 0;
}
