#include "runtime/RunFile.h"

#include <signal.h>

#include <cerrno>
#include <cstdlib>

#include <nlohmann/json.hpp>

#include "platform/FileContents.h"
#include "platform/FileSystem.h"
#include "runtime/JsonValues.h"

namespace tamber {

namespace {

constexpr const char* kFileName = "serve.json";

std::string stateHome() {
    if (const char* state = std::getenv("XDG_STATE_HOME"); state && *state == '/')
        return state;
    const char* home = std::getenv("HOME");
    return std::string(home ? home : "") + "/.local/state";
}

Error malformed() {
    return Error(kPosixErrorDomain, EINVAL, {{"description", "malformed server run file"}});
}

}  // namespace

Url RunFile::defaultLocation() {
    if (const char* runtime = std::getenv("XDG_RUNTIME_DIR"); runtime && *runtime == '/')
        return Url::fileURLWithPath(std::string(runtime) + "/tamber/" + kFileName);
    return Url::fileURLWithPath(stateHome() + "/tamber/run/" + kFileName);
}

Status RunFile::write(const Url& file, const RunFileRecord& record) {
    const Url folder = file.deletingLastPathComponent();
    if (auto made = FileContents::createDirectory(folder); !made.ok())
        return made;
    // The folder may have existed with looser permissions: the token must stay private.
    FileSystem& fs = FileSystem::current();
    if (fs.chmod(folder.path(), 0700) != 0)
        return Error::errorWithPOSIXCode(errno);
    nlohmann::json body = {{"pid", record.pid},
                           {"port", record.port},
                           {"token", record.token},
                           {"storage", record.storage}};
    const std::string text = jsonText(body) + "\n";
    return FileContents::writeAtomically(file, Bytes(text.begin(), text.end()), 0600);
}

Result<RunFileRecord> RunFile::read(const Url& file) {
    auto bytes = FileContents::read(file);
    if (!bytes.ok())
        return bytes.status().error();
    auto body = nlohmann::json::parse(bytes.value().begin(), bytes.value().end(), nullptr, false);
    if (!body.is_object())
        return malformed();
    auto pid = body.find("pid");
    auto port = body.find("port");
    auto token = body.find("token");
    auto storage = body.find("storage");
    if (pid == body.end() || !pid->is_number_integer() || port == body.end() ||
        !port->is_number_integer() || token == body.end() || !token->is_string() ||
        storage == body.end() || !storage->is_string())
        return malformed();
    RunFileRecord record;
    record.pid = pid->get<pid_t>();
    record.port = port->get<int>();
    record.token = token->get<std::string>();
    record.storage = storage->get<std::string>();
    if (record.pid <= 0 || record.port <= 0 || record.port > 65535 || record.token.empty())
        return malformed();
    return record;
}

void RunFile::remove(const Url& file, pid_t pid) {
    auto record = read(file);
    if (record.ok() && record.value().pid == pid)
        FileSystem::current().unlinkat(AT_FDCWD, file.path(), 0);
}

bool RunFile::isAlive(pid_t pid) {
    return pid > 0 && (::kill(pid, 0) == 0 || errno == EPERM);
}

std::optional<RunFileRecord> RunFile::liveServerFor(const Url& file,
                                                    const std::string& storagePath) {
    auto record = read(file);
    if (!record.ok() || !isAlive(record.value().pid))
        return std::nullopt;
    if (Url::fileURLWithPath(record.value().storage).path() !=
        Url::fileURLWithPath(storagePath).path())
        return std::nullopt;
    return record.value();
}

}  // namespace tamber
