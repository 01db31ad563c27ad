// Fuzz target: the password-policy JSON of server command 4, written to the settings and read back.
#include "fuzzroot.h"
#include "passwordpolicy.h"

#include <QJsonDocument>
#include <QSettings>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    const QString path = fuzzRoot().filePath(QStringLiteral("/etc/kest-iam.conf"));
    QFile::remove(path);
    {
        QSettings settings(path, QSettings::IniFormat);
        PasswordPolicy::write(settings, QJsonDocument::fromJson(fuzzInput(data, size)).object());
    }
    PasswordPolicy::read(QSettings(path, QSettings::IniFormat));
    return 0;
}
