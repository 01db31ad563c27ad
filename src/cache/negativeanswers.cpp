#include "negativeanswers.h"

#include "globalsetting.h"
#include "kestpaths.h"

namespace
{
template<typename Key> bool holdsIn(QHash<Key, QDeadlineTimer> &answers, const Key &key)
{
    const auto found = answers.find(key);
    if (found == answers.end())
        return false;
    if (!found->hasExpired())
        return true;
    answers.erase(found);
    return false;
}

template<typename Key> void rememberIn(QHash<Key, QDeadlineTimer> &answers, const Key &key, QDeadlineTimer until)
{
    if (answers.size() >= NegativeAnswers::limit) {
        for (auto answer = answers.begin(); answer != answers.end();)
            answer = answer->hasExpired() ? answers.erase(answer) : std::next(answer);
    }
    if (answers.size() >= NegativeAnswers::limit)
        answers.clear();
    answers.insert(key, until);
}
} // namespace

bool NegativeAnswers::settingsChanged()
{
    if (m_names.isEmpty() && m_uids.isEmpty())
        return false;
    if (FileVersion::of(KestPaths::settingsFile()) == m_settings)
        return false;
    m_names.clear();
    m_uids.clear();
    return true;
}

QDeadlineTimer NegativeAnswers::standing()
{
    const int seconds = GlobalSetting::instance()->negativeCacheTimeout();
    if (seconds <= 0)
        return QDeadlineTimer();
    if (m_names.isEmpty() && m_uids.isEmpty())
        m_settings = FileVersion::of(KestPaths::settingsFile());
    return QDeadlineTimer(qint64(seconds) * 1000);
}

bool NegativeAnswers::holds(const QString &name)
{
    return !settingsChanged() && holdsIn(m_names, name);
}

bool NegativeAnswers::holds(uint uid)
{
    return !settingsChanged() && holdsIn(m_uids, uid);
}

void NegativeAnswers::remember(const QString &name)
{
    settingsChanged();
    const QDeadlineTimer until = standing();
    if (!until.hasExpired())
        rememberIn(m_names, name, until);
}

void NegativeAnswers::remember(uint uid)
{
    settingsChanged();
    const QDeadlineTimer until = standing();
    if (!until.hasExpired())
        rememberIn(m_uids, uid, until);
}

bool NegativeAnswers::forget(const QString &name, uint uid)
{
    const bool named = m_names.remove(name) > 0;
    return m_uids.remove(uid) > 0 || named;
}

QList<NegativeAnswers::Standing> NegativeAnswers::current()
{
    settingsChanged();
    QList<Standing> answers;
    for (auto name = m_names.begin(); name != m_names.end();) {
        if (name->hasExpired()) {
            name = m_names.erase(name);
            continue;
        }
        answers.append({ name.key(), 0, *name });
        ++name;
    }
    for (auto uid = m_uids.begin(); uid != m_uids.end();) {
        if (uid->hasExpired()) {
            uid = m_uids.erase(uid);
            continue;
        }
        answers.append({ QString(), uid.key(), *uid });
        ++uid;
    }
    return answers;
}
