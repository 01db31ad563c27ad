#pragma once

#include <QByteArray>

#include <dlfcn.h>
#include <nss.h>

// The built name-service module loaded into this process, its entry points called the way glibc calls them.
class NssModule
{
public:
    NssModule();
    ~NssModule();
    NssModule(const NssModule &) = delete;
    NssModule &operator=(const NssModule &) = delete;

    bool isLoaded() const { return m_handle != nullptr; }
    QByteArray errorText() const { return m_error; }

    template<typename... Arguments> nss_status entryPoint(const char *name, Arguments... arguments) const
    {
        return reinterpret_cast<nss_status (*)(Arguments...)>(dlsym(m_handle, name))(arguments...);
    }
    // "status errno entry" of getpwnam, getpwuid, getgrnam or initgroups (from gid 10000) for key, the entry
    // as a passwd or group line or a gid list.
    QByteArray call(const QByteArray &function, const QByteArray &key, size_t bufferSize = 1024) const;

private:
    void *m_handle = nullptr;
    QByteArray m_error;
};
