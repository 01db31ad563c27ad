#include "accountmappublisher.h"

#include "cachestore.h"
#include "globalsetting.h"
#include "kestpaths.h"
#include "negativeanswers.h"
#include "userlistmanager.h"
#include "wholefile.h"

#include <QDateTime>
#include <QDebug>
#include <QFile>
#include <QFileInfo>

#include <limits>
#include <unistd.h>

namespace
{
const quint32 firstDomainUid = 10000;
// Readable by every process that looks accounts up; written by root alone.
const QFileDevice::Permissions mapPermissions
    = QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ReadGroup | QFileDevice::ReadOther;
// An ended negative answer left in the map is harmless while the clock runs on: one pass drops a batch.
const int expirySlackMs = 1000;
// Longer than any account name: such a name is left to the daemon, so that requests for many long names
// cannot grow the map past what the module maps.
const int longestPublishedName = 256;
} // namespace

AccountMapPublisher::AccountMapPublisher(const UserListManager *users, NegativeAnswers *negatives, QObject *parent)
    : QObject(parent)
    , m_users(users)
    , m_negatives(negatives)
    , m_watch(new ChangeWatch(this))
{
    m_settle.setSingleShot(true);
    m_settle.setInterval(settleMs);
    // The files' changes wait in the watch: the rebuild reads them.
    connect(&m_settle, &QTimer::timeout, this, [this]() { rewrite(false); });
    // A burst of events (a file written to a new name and renamed over the old) makes one rebuild.
    connect(m_watch, &ChangeWatch::changed, this, &AccountMapPublisher::negativeAnswersChanged);
    m_expiry.setSingleShot(true);
    connect(&m_expiry, &QTimer::timeout, this, [this]() { rewrite(false); });
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

void AccountMapPublisher::readRecord(quint32 uid)
{
    const FileVersion version = FileVersion::of(cacheFilePathOfUid(uid), false);
    // The walk lists regular files alone.
    if (!version.isRegularFile()) {
        m_kept.remove(uid);
        return;
    }
    m_kept.insert(uid, { version, version.isSettled(), readAccount(uid) });
}

void AccountMapPublisher::readAllRecords()
{
    QMap<quint32, Kept> kept;
    for (const quint32 uid : listCacheUids()) {
        const FileVersion version = FileVersion::of(cacheFilePathOfUid(uid), false);
        const auto known = m_kept.constFind(uid);
        if (known != m_kept.cend() && known->settled && known->version == version)
            kept.insert(uid, *known);
        else
            kept.insert(uid, { version, version.isSettled(), readAccount(uid) });
    }
    m_kept.swap(kept);
}

bool AccountMapPublisher::readChanges()
{
    m_watch->watchMissing();
    m_watch->poll();
    const ChangeWatch::Changes changes = m_watch->take();
    const QString records = KestPaths::workDir() + QLatin1Char('/');
    bool everything = changes.everything || m_walkDue;
    QList<quint32> uids;
    for (const QString &path : changes.paths) {
        // Only the settings file is watched outside the cache folder.
        if (!path.startsWith(records)) {
            everything = true;
            continue;
        }
        bool isNumber = false;
        const QString name = path.mid(records.size());
        const quint32 uid = name.toUInt(&isNumber, 10);
        if (isNumber && QString::number(uid) == name)
            uids.append(uid);
    }
    if (everything) {
        readAllRecords();
        m_walkDue = false;
        return true;
    }
    for (const quint32 uid : uids)
        readRecord(uid);
    // The group list and the user list are read or asked at every build.
    return !changes.isEmpty();
}

AccountMap AccountMapPublisher::collect() const
{
    AccountMap map;
    for (auto kept = m_kept.cbegin(); kept != m_kept.cend(); ++kept) {
        const std::optional<AccountMap::Account> &account = kept->account;
        if (account)
            map.addAccount(*account, !m_users || m_users->uidOfName(QString::fromUtf8(account->name)) == kept.key());
    }
    QFile groups(KestPaths::groupsFile());
    map.setGroupList(groups.open(QIODevice::ReadOnly) ? groups.readAll() : QByteArray());
    return map;
}

QList<AccountMap::NegativeAnswer> AccountMapPublisher::standingNegatives()
{
    QList<AccountMap::NegativeAnswer> answers;
    m_expiry.stop();
    if (!m_negatives)
        return answers;
    const qint64 now = QDateTime::currentMSecsSinceEpoch();
    qint64 first = -1;
    for (const NegativeAnswers::Standing &standing : m_negatives->current()) {
        const qint64 left = standing.until.remainingTime();
        const QByteArray name = standing.name.toUtf8();
        if (left < 0 || name.size() > longestPublishedName)
            continue;
        // Whole seconds, rounded down: the map never answers "no" longer than the daemon would.
        answers.append({ name, standing.uid, (now + left) / 1000 });
        first = first < 0 ? left : qMin(first, left);
    }
    if (first >= 0)
        m_expiry.start(int(qMin<qint64>(first + expirySlackMs, std::numeric_limits<int>::max())));
    return answers;
}

bool AccountMapPublisher::publish()
{
    return rewrite(true);
}

void AccountMapPublisher::negativeAnswersChanged()
{
    if (!m_settle.isActive())
        m_settle.start();
}

void AccountMapPublisher::dropNegativeAnswers()
{
    m_negatives = nullptr;
    if (!m_published.isEmpty())
        rewrite(false);
    m_expiry.stop();
}

bool AccountMapPublisher::rewrite(bool accountsChanged)
{
    m_settle.stop();
    if (!GlobalSetting::instance()->isEnabled()) {
        // Nothing is read while the map is withdrawn: the next build starts from a walk.
        m_watch->poll();
        m_watch->take();
        m_kept.clear();
        m_walkDue = true;
        m_accountPart.clear();
        withdraw();
        return true;
    }
    if (readChanges() || accountsChanged || m_accountPart.isEmpty())
        m_accountPart = collect().toBytes();
    const QByteArray bytes
        = AccountMap::withNegativeAnswers(m_accountPart, standingNegatives(), m_negatives ? quint32(getpid()) : 0);
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
