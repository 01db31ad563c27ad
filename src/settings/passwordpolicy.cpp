#include "passwordpolicy.h"

#include <QSettings>
#include <QVariant>

namespace
{
enum class Type { Bool, Int, Text };

struct Key {
    const char *group;
    const char *key;
    Type type;
};

const Key keys[] = {
    { "pw_strength", "character_enable", Type::Bool },
    { "pw_strength", "characters", Type::Text },
    { "pw_strength", "contains_user", Type::Bool },
    { "pw_strength", "lower", Type::Bool },
    { "pw_strength", "max_length", Type::Int },
    { "pw_strength", "min_length", Type::Int },
    { "pw_strength", "number", Type::Bool },
    { "pw_strength", "required", Type::Int },
    { "pw_strength", "special_enable", Type::Bool },
    { "pw_strength", "special_string", Type::Text },
    // Deliberately a boolean, unlike the numeric "required" beside it.
    { "pw_strength", "strength", Type::Bool },
    { "pw_strength", "upper", Type::Bool },
    { "pw_validity", "enable", Type::Bool },
    { "pw_validity", "effective_time", Type::Int },
    { "pw_validity", "tip_time", Type::Int },
    { "pw_history_check", "enable", Type::Bool },
    { "pw_history_check", "history_num", Type::Int },
    { "first_login", "enable", Type::Bool },
    { "first_login", "update_password", Type::Bool },
    { "offline_login", "enable", Type::Bool },
    { "offline_login", "cache_validity", Type::Int },
};

QVariant converted(const QVariant &value, Type type)
{
    switch (type) {
    case Type::Bool:
        return value.toBool();
    case Type::Int:
        return value.toInt();
    case Type::Text:
        break;
    }
    return value.toString();
}

QString settingsKey(const Key &entry)
{
    return QLatin1String(entry.group) + QLatin1Char('/') + QLatin1String(entry.key);
}
} // namespace

const char *const PasswordPolicy::groupNames[5]
    = { "pw_strength", "pw_validity", "pw_history_check", "first_login", "offline_login" };

QJsonObject PasswordPolicy::read(const QSettings &settings)
{
    QJsonObject policy;
    for (const Key &entry : keys) {
        const QString group = QLatin1String(entry.group);
        QJsonObject values = policy.value(group).toObject();
        values.insert(QLatin1String(entry.key),
            QJsonValue::fromVariant(converted(settings.value(settingsKey(entry)), entry.type)));
        policy.insert(group, values);
    }
    return policy;
}

void PasswordPolicy::write(QSettings &settings, const QJsonObject &policy)
{
    for (const Key &entry : keys) {
        const QJsonObject values = policy.value(QLatin1String(entry.group)).toObject();
        if (values.contains(QLatin1String(entry.key)))
            settings.setValue(
                settingsKey(entry), converted(values.value(QLatin1String(entry.key)).toVariant(), entry.type));
    }
    settings.sync();
}
