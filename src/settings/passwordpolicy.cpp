#include "passwordpolicy.h"

#include "settingsschema.h"

#include <QSettings>
#include <QVariant>

namespace
{
using Key = SettingsSchema::Key;

QVariant converted(const QVariant &value, SettingsSchema::Type type)
{
    switch (type) {
    case SettingsSchema::Type::Bool:
        return value.toBool();
    case SettingsSchema::Type::Int:
        return value.toInt();
    default:
        break;
    }
    return value.toString();
}

QString settingsKey(const Key &entry)
{
    return QLatin1String(entry.group) + QLatin1Char('/') + QLatin1String(entry.name);
}
} // namespace

const char *const PasswordPolicy::groupNames[5]
    = { "pw_strength", "pw_validity", "pw_history_check", "first_login", "offline_login" };

QJsonObject PasswordPolicy::read(const QSettings &settings)
{
    QJsonObject policy;
    for (const Key *entry : SettingsSchema::policyKeys()) {
        const QString group = QLatin1String(entry->group);
        QJsonObject values = policy.value(group).toObject();
        values.insert(QLatin1String(entry->name),
            QJsonValue::fromVariant(converted(settings.value(settingsKey(*entry)), entry->type)));
        policy.insert(group, values);
    }
    return policy;
}

void PasswordPolicy::write(QSettings &settings, const QJsonObject &policy)
{
    for (const Key *entry : SettingsSchema::policyKeys()) {
        const QJsonObject values = policy.value(QLatin1String(entry->group)).toObject();
        if (values.contains(QLatin1String(entry->name)))
            settings.setValue(
                settingsKey(*entry), converted(values.value(QLatin1String(entry->name)).toVariant(), entry->type));
    }
    settings.sync();
}
