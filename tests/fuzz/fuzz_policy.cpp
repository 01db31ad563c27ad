// Fuzz target: the password-policy JSON of server command 4, written to the settings and read back.
#include "fuzzroot.h"
#include "passwordpolicy.h"

#include <QFile>
#include <QJsonDocument>
#include <QSettings>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    const FuzzRoot &root = FuzzRoot::instance();
    const QJsonDocument document
        = QJsonDocument::fromJson(QByteArray::fromRawData(reinterpret_cast<const char *>(data), int(size)));
    const QString path = root.path(QStringLiteral("/etc/kest-iam.conf"));
    QFile::remove(path);
    {
        QSettings settings(path, QSettings::IniFormat);
        PasswordPolicy::write(settings, document.object());
    }
    const QSettings settings(path, QSettings::IniFormat);
    PasswordPolicy::read(settings);
    return 0;
}
