#include "settingsschema.h"

#include <QStringList>
#include <QVector>

#include <algorithm>
#include <climits>
#include <iterator>

namespace
{
using Type = SettingsSchema::Type;
const int noLimit = INT_MAX;

const SettingsSchema::Key keys[] = {
    { "main", "enable", Type::Bool, 0, 0 },
    { "main", "ip", Type::Text, 0, 0 },
    { "main", "port", Type::Int, 1, 65535 },
    { "main", "network-timeout", Type::Int, 1, 3600 },
    { "main", "domain", Type::Text, 0, 0 },
    { "main", "entryption", Type::Text, 0, 0 },
    { "main", "home", Type::Text, 0, 0 },
    { "main", "debug", Type::Bool, 0, 0 },
    { "main", "network-frequency", Type::Int, 0, noLimit },
    { "main", "dbus-timeout", Type::Int, 0, noLimit },
    { "main", "max-failed-logins", Type::Int, 0, noLimit },
    { "main", "failed-login-delay", Type::Int, 0, noLimit },
    { "main", "negative-cache-timeout", Type::Int, 0, noLimit },
    { "url", "protocol", Type::Text, 0, 0 },
    { "url", "user", Type::Text, 0, 0 },
    { "url", "auth", Type::Text, 0, 0 },
    { "url", "group", Type::Text, 0, 0 },
    { "url", "reset_password", Type::Text, 0, 0 },
    { "url", "domain", Type::Text, 0, 0 },
    { "url", "server-cert", Type::AuthorityFile, 0, 0 },
    { "url", "public-key", Type::CertificateFile, 0, 0 },
    { "url", "private-key", Type::KeyFile, 0, 0 },
    { "passwd", "length-limit", Type::Int, 1, noLimit },
    { "passwd", "buffer-limit", Type::Int, 1, noLimit },
    { "group", "length-limit", Type::Int, 1, noLimit },
    { "group", "member-count-limit", Type::Int, 0, noLimit },
    { "group", "buffer-limit", Type::Int, 1, noLimit },
    { "offline_login", "enable", Type::Bool, 0, 0, true },
    // Days; a negative number reads as 0, which lets no account log in offline at all.
    { "offline_login", "cache_validity", Type::Int, 0, 49710, true },
    { "pw_strength", "character_enable", Type::Bool, 0, 0, true },
    { "pw_strength", "characters", Type::Text, 0, 0, true },
    { "pw_strength", "contains_user", Type::Bool, 0, 0, true },
    { "pw_strength", "lower", Type::Bool, 0, 0, true },
    { "pw_strength", "max_length", Type::Int, 0, noLimit, true },
    { "pw_strength", "min_length", Type::Int, 0, noLimit, true },
    { "pw_strength", "number", Type::Bool, 0, 0, true },
    { "pw_strength", "required", Type::Int, 0, noLimit, true },
    { "pw_strength", "special_enable", Type::Bool, 0, 0, true },
    { "pw_strength", "special_string", Type::Text, 0, 0, true },
    // Deliberately a boolean, unlike the numeric "required" beside it.
    { "pw_strength", "strength", Type::Bool, 0, 0, true },
    { "pw_strength", "upper", Type::Bool, 0, 0, true },
    { "pw_validity", "enable", Type::Bool, 0, 0, true },
    { "pw_validity", "effective_time", Type::Int, 0, noLimit, true },
    { "pw_validity", "tip_time", Type::Int, 0, noLimit, true },
    { "pw_history_check", "enable", Type::Bool, 0, 0, true },
    { "pw_history_check", "history_num", Type::Int, 0, noLimit, true },
    { "first_login", "enable", Type::Bool, 0, 0, true },
    { "first_login", "update_password", Type::Bool, 0, 0, true },
};

int editDistance(const QString &a, const QString &b)
{
    QVector<int> previous(b.size() + 1), current(b.size() + 1);
    for (int j = 0; j <= b.size(); ++j)
        previous[j] = j;
    for (int i = 1; i <= a.size(); ++i) {
        current[0] = i;
        for (int j = 1; j <= b.size(); ++j) {
            const int substitution = previous[j - 1] + (a.at(i - 1) == b.at(j - 1) ? 0 : 1);
            current[j] = std::min({ previous[j] + 1, current[j - 1] + 1, substitution });
        }
        std::swap(previous, current);
    }
    return previous[b.size()];
}

// A value given as a list (an unquoted comma) is read as that list, never as one number or switch.
QString scalarText(const QVariant &value, bool &isList)
{
    isList = value.type() == QVariant::StringList;
    return isList ? value.toStringList().join(QLatin1Char(',')) : value.toString();
}
} // namespace

const SettingsSchema::Key *SettingsSchema::find(const QString &group, const QString &name)
{
    const auto found = std::find_if(std::begin(keys), std::end(keys),
        [&](const Key &key) { return group == QLatin1String(key.group) && name == QLatin1String(key.name); });
    return found == std::end(keys) ? nullptr : found;
}

QList<const SettingsSchema::Key *> SettingsSchema::policyKeys()
{
    QList<const Key *> found;
    for (const Key &key : keys) {
        if (key.policy)
            found.append(&key);
    }
    return found;
}

bool SettingsSchema::isKnownGroup(const QString &group)
{
    return std::any_of(
        std::begin(keys), std::end(keys), [&](const Key &key) { return group == QLatin1String(key.group); });
}

QString SettingsSchema::nearestKey(const QString &group, const QString &name)
{
    const Key *best = nullptr;
    int bestDistance = INT_MAX;
    for (const Key &key : keys) {
        // Twice the distance, less one within the group: the group breaks a tie.
        const int distance
            = 2 * editDistance(name, QLatin1String(key.name)) - (group == QLatin1String(key.group) ? 1 : 0);
        if (distance < bestDistance) {
            bestDistance = distance;
            best = &key;
        }
    }
    return QStringLiteral("[%1] %2").arg(QLatin1String(best->group), QLatin1String(best->name));
}

QString SettingsSchema::nearestGroup(const QString &group)
{
    QString best;
    int bestDistance = INT_MAX;
    for (const Key &key : keys) {
        const int distance = editDistance(group, QLatin1String(key.group));
        if (distance < bestDistance) {
            bestDistance = distance;
            best = QLatin1String(key.group);
        }
    }
    return best;
}

QString SettingsSchema::valueProblem(const Key &key, const QVariant &value)
{
    bool isList = false;
    const QString text = scalarText(value, isList);
    const QString shown = QLatin1Char('"') + text + QLatin1Char('"');
    switch (key.type) {
    case Type::Bool: {
        const QString lower = text.toLower();
        if (isList
            || (lower != QLatin1String("true") && lower != QLatin1String("false") && text != QLatin1String("1")
                && text != QLatin1String("0")))
            return shown + QStringLiteral(" is not a boolean (true or false)");
        return QString();
    }
    case Type::Int: {
        bool ok = false;
        const qlonglong number = isList ? 0 : text.toLongLong(&ok);
        if (!ok || number < key.minimum || number > key.maximum) {
            const QString range = key.maximum == noLimit
                ? QStringLiteral(" of at least %1").arg(key.minimum)
                : QStringLiteral(" in %1-%2").arg(key.minimum).arg(key.maximum);
            return shown + QStringLiteral(" is not a whole number") + range;
        }
        return QString();
    }
    case Type::Text:
    case Type::AuthorityFile:
    case Type::CertificateFile:
    case Type::KeyFile:
        break;
    }
    return QString();
}

int SettingsSchema::portValue(const QVariant &value, QString *problem)
{
    const QString found = valueProblem(*find(QStringLiteral("main"), QStringLiteral("port")), value);
    if (problem)
        *problem = found;
    return found.isEmpty() ? value.toInt() : 0;
}
