// Files and folders by full path.
#pragma once

#include <string>

#include "platform/Export.h"
#include "platform/Strings.h"

namespace tidelink::platform {

class TIDELINK_EXPORT File {
public:
    File() = default;
    explicit File(std::string path) : mPath(std::move(path)) {}
    explicit File(const WString& path) : mPath(ToUTF8(path)) {}

    const std::string& Path() const { return mPath; }
    WString FullPath() const { return ToUTF16(mPath); }
    bool Exists() const;        // a regular file (symbolic links followed)
    bool IsSymlink() const;     // the path itself is a symbolic link
    // Target of a symbolic link as a full path, empty when it is none or dangles.
    std::string ResolveLink() const;
    std::string Name() const;   // last path component
    bool operator==(const File& o) const { return mPath == o.mPath; }

private:
    std::string mPath;
};

class TIDELINK_EXPORT Dir {
public:
    Dir() = default;
    explicit Dir(std::string path) : mPath(std::move(path)) {}

    // Where the suite's helper programs live: TIDELINK_PACKAGE_DIR when set; otherwise the
    // libexec folder of the installation that holds this library; otherwise (build trees) the
    // library's own folder.
    static Dir PackageDir();
    // Folder of the running executable; TIDELINK_APP_DIR overrides it.
    static Dir AppDir();

    const std::string& Path() const { return mPath; }
    bool Exists() const;
    File GetFile(const std::string& name) const;

private:
    std::string mPath;
};

}  // namespace tidelink::platform
