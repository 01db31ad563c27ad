#include "settingscheck.h"

#include "clientcredentials.h"
#include "settingsschema.h"

#include <QDateTime>
#include <QFile>
#include <QHash>
#include <QSettings>
#include <QSslCertificate>
#include <QTextStream>

#include <algorithm>

namespace
{
using Severity = SettingsFinding::Severity;
using Type = SettingsSchema::Type;

// Where a key was given; QSettings keeps no line numbers.
struct Entry {
    QString group;
    QString key;
    int line;
};

class Checker
{
public:
    explicit Checker(const QString &path)
        : m_path(path)
        , m_settings(path, QSettings::IniFormat)
    {
    }

    QList<SettingsFinding> run();

private:
    void add(Severity severity, const Entry &entry, const QString &message)
    {
        m_findings.append(SettingsFinding { severity, entry.group, entry.key, entry.line, message });
    }
    QList<Entry> scanLines();
    void checkEntry(const Entry &entry);
    void checkFile(const Entry &entry, Type type, const QString &file);
    void checkCertificates(const Entry &entry, const QList<QSslCertificate> &certificates, bool all);
    void checkKeyPair();
    void checkUnset();
    QVariant value(const Entry &entry) const
    {
        const bool general = entry.group == QLatin1String("General");
        return m_settings.value(general ? entry.key : entry.group + QLatin1Char('/') + entry.key);
    }

    QString m_path;
    QSettings m_settings;
    QList<SettingsFinding> m_findings;
    QHash<QString, Entry> m_files; // the certificate and key entries that could be read, by key
    QHash<QString, int> m_lines; // "group/key" to the line that gives it
    QList<QSslCertificate> m_chain;
};

QList<Entry> Checker::scanLines()
{
    QList<Entry> entries;
    QFile file(m_path);
    if (!file.open(QIODevice::ReadOnly | QIODevice::Text))
        return entries;
    QTextStream stream(&file);
    QString group = QStringLiteral("General");
    bool knownGroup = true;
    for (int number = 1; !stream.atEnd(); ++number) {
        const QString line = stream.readLine().trimmed();
        if (line.isEmpty() || line.startsWith(QLatin1Char(';')) || line.startsWith(QLatin1Char('#')))
            continue;
        if (line.startsWith(QLatin1Char('[')) && line.endsWith(QLatin1Char(']'))) {
            group = line.mid(1, line.size() - 2).trimmed();
            knownGroup = SettingsSchema::isKnownGroup(group);
            if (!knownGroup)
                add(Severity::Warning, Entry { group, QString(), number },
                    QStringLiteral("unknown group, ignored (nearest known: [%1])")
                        .arg(SettingsSchema::nearestGroup(group)));
            continue;
        }
        const int equals = line.indexOf(QLatin1Char('='));
        if (equals <= 0) {
            add(Severity::Warning, Entry { group, QString(), number },
                QStringLiteral("not a key=value line, ignored: ") + line);
            continue;
        }
        if (!knownGroup)
            continue;
        entries.append(Entry { group, line.left(equals).trimmed(), number });
        m_lines.insert(group + QLatin1Char('/') + entries.last().key, number);
    }
    return entries;
}

void Checker::checkEntry(const Entry &entry)
{
    const SettingsSchema::Key *key = SettingsSchema::find(entry.group, entry.key);
    if (!key) {
        add(Severity::Warning, entry,
            QStringLiteral("unknown key, ignored (nearest known: %1)")
                .arg(SettingsSchema::nearestKey(entry.group, entry.key)));
        return;
    }
    const QVariant given = value(entry);
    const QString problem = SettingsSchema::valueProblem(*key, given);
    if (!problem.isEmpty()) {
        add(Severity::Error, entry, problem);
        return;
    }
    if (key->type == Type::AuthorityFile || key->type == Type::CertificateFile || key->type == Type::KeyFile)
        checkFile(entry, key->type, given.toString());
}

void Checker::checkCertificates(const Entry &entry, const QList<QSslCertificate> &certificates, bool all)
{
    const QDateTime now = QDateTime::currentDateTimeUtc();
    for (const QSslCertificate &certificate : certificates) {
        if (certificate.expiryDate() < now)
            add(Severity::Error, entry,
                QStringLiteral("certificate \"%1\" expired on %2")
                    .arg(certificate.subjectDisplayName(), certificate.expiryDate().toString(Qt::ISODate)));
        else if (certificate.effectiveDate() > now)
            add(Severity::Error, entry,
                QStringLiteral("certificate \"%1\" is not valid before %2")
                    .arg(certificate.subjectDisplayName(), certificate.effectiveDate().toString(Qt::ISODate)));
        if (!all)
            return;
    }
}

void Checker::checkFile(const Entry &entry, Type type, const QString &file)
{
    if (file.isEmpty())
        return;
    const QString reason = ClientCredentials::unreadableReason(file);
    if (!reason.isEmpty()) {
        add(Severity::Error, entry, file + QStringLiteral(": ") + reason);
        return;
    }
    QFile input(file);
    input.open(QIODevice::ReadOnly);
    const QByteArray content = input.readAll();
    if (type == Type::KeyFile) {
        if (QSslKey(content, QSsl::Rsa, QSsl::Pem, QSsl::PrivateKey).isNull())
            add(Severity::Error, entry, file + QStringLiteral(": holds no PEM RSA private key"));
        else
            m_files.insert(entry.key, entry);
        return;
    }
    const QList<QSslCertificate> certificates = QSslCertificate::fromData(content, QSsl::Pem);
    if (certificates.isEmpty()) {
        add(Severity::Error, entry, file + QStringLiteral(": holds no PEM certificate"));
        return;
    }
    checkCertificates(entry, certificates, type == Type::AuthorityFile);
    if (type == Type::CertificateFile) {
        m_chain = certificates;
        m_files.insert(entry.key, entry);
    }
}

void Checker::checkKeyPair()
{
    if (!m_files.contains(QStringLiteral("private-key")) || m_chain.isEmpty())
        return;
    const Entry entry = m_files.value(QStringLiteral("private-key"));
    QFile input(value(entry).toString());
    input.open(QIODevice::ReadOnly);
    const QSslKey key(&input, QSsl::Rsa, QSsl::Pem, QSsl::PrivateKey);
    if (!ClientCredentials::keyMatches(key, m_chain.first()))
        add(Severity::Error, entry,
            QStringLiteral("the key does not belong to the certificate of [url] public-key (line %1)")
                .arg(m_files.value(QStringLiteral("public-key")).line));
}

// Switched on over TLS, the client needs all three files; without them every request would be refused.
void Checker::checkUnset()
{
    const QString protocol = m_settings.value(QStringLiteral("url/protocol"), QStringLiteral("https://")).toString();
    if (!m_settings.value(QStringLiteral("main/enable")).toBool() || protocol != QLatin1String("https://"))
        return;
    for (const char *name : { "server-cert", "public-key", "private-key" }) {
        const QString key = QLatin1String(name);
        if (m_settings.value(QStringLiteral("url/") + key).toString().isEmpty())
            add(Severity::Warning, Entry { QStringLiteral("url"), key, m_lines.value(QStringLiteral("url/") + key) },
                QStringLiteral("not set, while the service is switched on and the protocol is https://"));
    }
}

QList<SettingsFinding> Checker::run()
{
    if (!QFile::exists(m_path)) {
        add(Severity::Error, Entry(), QStringLiteral("the settings file is missing: every setting takes its default"));
        return m_findings;
    }
    if (m_settings.status() != QSettings::NoError)
        add(Severity::Error, Entry(), QStringLiteral("the settings file cannot be read"));
    const QList<Entry> entries = scanLines();
    for (const Entry &entry : entries)
        checkEntry(entry);
    checkKeyPair();
    checkUnset();
    std::stable_sort(m_findings.begin(), m_findings.end(),
        [](const SettingsFinding &a, const SettingsFinding &b) { return a.line < b.line; });
    return m_findings;
}
} // namespace

QString SettingsFinding::text(const QString &path) const
{
    QString where = path + QLatin1Char(':');
    if (line > 0)
        where += QString::number(line) + QLatin1Char(':');
    where += severity == Severity::Error ? QStringLiteral(" error: ") : QStringLiteral(" warning: ");
    if (!group.isEmpty())
        where += QLatin1Char('[') + group + QStringLiteral("] ");
    if (!key.isEmpty())
        where += key + QLatin1Char(' ');
    if (!group.isEmpty() || !key.isEmpty())
        where.replace(where.size() - 1, 1, QStringLiteral(": "));
    return where + message;
}

QList<SettingsFinding> SettingsCheck::check(const QString &path)
{
    return Checker(path).run();
}

int SettingsCheck::exitStatus(const QList<SettingsFinding> &findings)
{
    int status = 0;
    for (const SettingsFinding &finding : findings)
        status = qMax(status, finding.severity == SettingsFinding::Severity::Error ? 2 : 1);
    return status;
}
