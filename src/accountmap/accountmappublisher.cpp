#include "accountmappublisher.h"

#include "cachestore.h"
#include "changewatch.h"
#include "globalsetting.h"
#include "kestpaths.h"
#include "userlistmanager.h"
#include "wholefile.h"

#include <QDebug>
#include <QFile>
#include <QFileInfo>

#include <algorithm>

namespace
{
const quint32 firstDomainUid = 10000;
// Readable by every process that looks accounts up; written by root alone.
const QFileDevice::Permissions mapPermissions
    = QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther;
} // namespace

AccountMapPublisher::AccountMapPublisher(const UserListManager *users, QObject *parent)
    : QObject(parent)
    , m_users(users)
    , m_watch(new ChangeWatch(this))
{
    m_settle.setSingleShot(true);
    m_settle.setInterval(settleMs);
    connect(&m_settle, &QTimer::timeout, this, &AccountMapPublisher::publish);
    // A burst of events (a file written to a new name and renamed over the old) makes one rebuild.
    connect(m_watch, &ChangeWatch::changed, this, [this]() {
        if (!m_settle.isActive())
            m_settle.start();
    });
    m_watch->watch(KestPaths::workDir());
    const QFileInfo settings(KestPaths::settingsFile());
    m_watch->watch(settings.absolutePath(), settings.fileName());
}

AccountMapPublisher::~AccountMapPublisher() = default;

// The entry the daemon answers for uid (an account cached, not marked for removal), without its password.
std::optional<AccountMap::Account> AccountMapPublisher::readAccount(quint32 uid) const
{
    const CacheControlPtr record = uid >= firstDomainUid ? readCacheRecord(uid) : CacheControlPtr();
    if (!record || record->uid() != uid || record->account().isEmpty() || record->removeStatus() != 0)
        return std::nullopt;
    return AccountMap::Account { uid, record->mainGid(), record->account().toUtf8(), record->gecos().toUtf8(),
        record->homePath().toUtf8(), record->loginShell().toUtf8() };
}

AccountMap AccountMapPublisher::collect()
{
    AccountMap map;
    QList<quint32> uids = listCacheUids();
    std::sort(uids.begin(), uids.end());
    QHash<quint32, Kept> kept;
    kept.reserve(uids.size());
    for (const quint32 uid : uids) {
        const FileVersion version = FileVersion::of(cacheFilePathOfUid(uid), false);
        const auto known = m_kept.constFind(uid);
        const std::optional<AccountMap::Account> account
            = known != m_kept.cend() && known->version == version ? known->account : readAccount(uid);
        // A file changed within the clock's tick could change again unseen: read again next time.
        if (version.isSettled())
            kept.insert(uid, { version, account });
        if (account)
            map.addAccount(*account, !m_users || m_users->uidOfName(QString::fromUtf8(account->name)) == uid);
    }
    m_kept.swap(kept);
    QFile groups(KestPaths::groupsFile());
    map.setGroupList(groups.open(QIODevice::ReadOnly) ? groups.readAll() : QByteArray());
    return map;
}

bool AccountMapPublisher::publish()
{
    m_watch->watchMissing();
    if (!GlobalSetting::instance()->isEnabled()) {
        withdraw();
        return true;
    }
    const QByteArray bytes = collect().toBytes();
    const QString path = KestPaths::accountMapFile();
    const FileVersion now = FileVersion::of(path, false);
    if (bytes == m_published && now == m_publishedVersion)
        return true;
    // Someone else's hand was on the file (owner, mode, contents): it is replaced, never trusted.
    if (now.exists() && !(now == m_publishedVersion))
        QFile::remove(path);
    QString error;
    // A failed write is logged by the writer, and the last map stays in place.
    if (!WholeFile::write(path, bytes, mapPermissions, error)) {
        m_published.clear();
        return false;
    }
    m_published = bytes;
    m_publishedVersion = FileVersion::of(path, false);
    return true;
}

void AccountMapPublisher::withdraw()
{
    const QString path = KestPaths::accountMapFile();
    if (FileVersion::of(path, false).exists() && !QFile::remove(path))
        qWarning().noquote() << QStringLiteral("cannot withdraw the account map ") + path;
    m_published.clear();
    m_publishedVersion = FileVersion();
}
