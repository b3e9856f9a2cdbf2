#include "platform/TypeIdentifiers.h"

#include <array>
#include <cstddef>
#include <unordered_map>

#include "platform/UrlPath.h"

namespace tamber {

namespace {

struct TypeDeclaration {
    std::string_view type;
    std::array<std::string_view, 2> parents;  // empty entries unused
};

// The conformance graph. Every type reaches "public.item".
constexpr TypeDeclaration kTypes[] = {
    {"public.item", {}},
    {"public.directory", {"public.item"}},
    {"public.folder", {"public.directory"}},
    {"public.package", {"public.directory"}},
    {"public.symlink", {"public.item"}},
    {"public.data", {"public.item"}},
    {"public.content", {"public.item"}},
    {"public.text", {"public.data", "public.content"}},
    {"public.plain-text", {"public.text"}},
    {"public.utf8-plain-text", {"public.plain-text"}},
    {"public.json", {"public.text"}},
    {"public.xml", {"public.text"}},
    {"public.html", {"public.text"}},
    {"public.source-code", {"public.plain-text"}},
    {"public.image", {"public.data", "public.content"}},
    {"public.png", {"public.image"}},
    {"public.jpeg", {"public.image"}},
    {"public.gif", {"public.image"}},
    {"public.tiff", {"public.image"}},
    {"public.heic", {"public.image"}},
    {"public.svg-image", {"public.image"}},
    {"org.webmproject.webp", {"public.image"}},
    {"com.microsoft.bmp", {"public.image"}},
    {"public.pdf", {"public.data", "public.content"}},
    {"public.archive", {"public.data"}},
    {"public.zip-archive", {"public.archive"}},
    {"org.gnu.gnu-zip-archive", {"public.archive"}},
    {"public.tar-archive", {"public.archive"}},
    {"public.audio", {"public.data", "public.content"}},
    {"public.mp3", {"public.audio"}},
    {"public.mpeg-4-audio", {"public.audio"}},
    {"public.movie", {"public.data", "public.content"}},
    {"public.mpeg-4", {"public.movie"}},
    {"com.velk.lumen.presentation", {"public.package", "public.content"}},
    {"com.velk.resona.song", {"public.package", "public.content"}},
    {"com.velk.bundle", {"public.package"}},
};

struct ExtensionMapping {
    std::string_view extension;  // lower case
    std::string_view type;
};

constexpr ExtensionMapping kExtensions[] = {
    {"txt", "public.plain-text"},
    {"text", "public.plain-text"},
    {"md", "public.plain-text"},
    {"csv", "public.plain-text"},
    {"json", "public.json"},
    {"xml", "public.xml"},
    {"html", "public.html"},
    {"htm", "public.html"},
    {"c", "public.source-code"},
    {"h", "public.source-code"},
    {"cc", "public.source-code"},
    {"cpp", "public.source-code"},
    {"hpp", "public.source-code"},
    {"py", "public.source-code"},
    {"js", "public.source-code"},
    {"sh", "public.source-code"},
    {"png", "public.png"},
    {"jpg", "public.jpeg"},
    {"jpeg", "public.jpeg"},
    {"gif", "public.gif"},
    {"tif", "public.tiff"},
    {"tiff", "public.tiff"},
    {"heic", "public.heic"},
    {"svg", "public.svg-image"},
    {"webp", "org.webmproject.webp"},
    {"bmp", "com.microsoft.bmp"},
    {"pdf", "public.pdf"},
    {"zip", "public.zip-archive"},
    {"gz", "org.gnu.gnu-zip-archive"},
    {"gzip", "org.gnu.gnu-zip-archive"},
    {"tar", "public.tar-archive"},
    {"mp3", "public.mp3"},
    {"m4a", "public.mpeg-4-audio"},
    {"mp4", "public.mpeg-4"},
    {"lumen", "com.velk.lumen.presentation"},
    {"resona", "com.velk.resona.song"},
    {"bundle", "com.velk.bundle"},
};

char lower(char c) {
    return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c;
}

// Case-insensitive (ASCII) hashing and comparison, so that a query needs no lower-cased copy.
struct CaseInsensitiveHash {
    size_t operator()(std::string_view s) const {
        size_t h = 14695981039346656037ull;
        for (char c : s) h = (h ^ static_cast<unsigned char>(lower(c))) * 1099511628211ull;
        return h;
    }
};
struct CaseInsensitiveEqual {
    bool operator()(std::string_view a, std::string_view b) const {
        if (a.size() != b.size())
            return false;
        for (size_t i = 0; i < a.size(); ++i) {
            if (lower(a[i]) != lower(b[i]))
                return false;
        }
        return true;
    }
};

const std::unordered_map<std::string_view, const TypeDeclaration*>& typeTable() {
    static const auto table = [] {
        std::unordered_map<std::string_view, const TypeDeclaration*> map;
        for (const TypeDeclaration& declaration : kTypes)
            map.emplace(declaration.type, &declaration);
        return map;
    }();
    return table;
}

const std::unordered_map<std::string_view, std::string_view, CaseInsensitiveHash,
                         CaseInsensitiveEqual>&
extensionTable() {
    static const auto table = [] {
        std::unordered_map<std::string_view, std::string_view, CaseInsensitiveHash,
                           CaseInsensitiveEqual>
            map;
        for (const ExtensionMapping& mapping : kExtensions) {
            map.emplace(mapping.extension, mapping.type);
        }
        return map;
    }();
    return table;
}

bool conformsInGraph(std::string_view type, std::string_view target) {
    if (type == target)
        return true;
    auto it = typeTable().find(type);
    if (it == typeTable().end())
        return false;
    for (std::string_view parent : it->second->parents) {
        if (!parent.empty() && conformsInGraph(parent, target))
            return true;
    }
    return false;
}

// The registered type of a name's extension; empty when there is none.
std::string_view typeForExtension(std::string_view name) {
    std::string_view extension = UrlPath::extension(name);
    if (extension.empty())
        return {};
    auto it = extensionTable().find(extension);
    return it == extensionTable().end() ? std::string_view() : it->second;
}

bool isPackageType(std::string_view type) {
    return !type.empty() && conformsInGraph(type, TypeIdentifiers::kPackage);
}

}  // namespace

bool TypeConforms(std::string_view type, std::string_view conformsTo) {
    if (type == conformsTo || conformsTo == TypeIdentifiers::kItem)
        return true;
    return conformsInGraph(type, conformsTo);
}

std::string TypeIdentifierForName(std::string_view name, bool isDirectory) {
    std::string_view type = typeForExtension(name);
    if (isDirectory) {
        return std::string(isPackageType(type) ? type : TypeIdentifiers::kFolder);
    }
    // A plain file never conforms to the directory types, whatever its name says.
    if (type.empty() || isPackageType(type))
        return std::string(TypeIdentifiers::kData);
    return std::string(type);
}

bool IsPackageName(std::string_view name) {
    return isPackageType(typeForExtension(name));
}

}  // namespace tamber
