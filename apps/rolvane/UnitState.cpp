#include "UnitState.h"

#include <cstdio>
#include <memory>

namespace rolvane::cli {

UnitState unitStateFrom(const std::string& shown) {
    const auto says = [&](const std::string& line) {
        return ("\n" + shown).find("\n" + line + "\n") != std::string::npos;
    };
    constexpr const char* kNoUserNamespace = "ExecMainStatus=217";
    return {.loaded = says("LoadState=loaded"),
            .enabled = says("UnitFileState=enabled"),
            .needsReload = says("NeedDaemonReload=yes"),
            .confined = says("NoNewPrivileges=yes"),
            .apart = says("PrivateUsers=yes"),
            .forbidden = says(kNoUserNamespace)};
}

std::optional<UnitState> managersUnitState() {
    struct Close {
        void operator()(FILE* pipe) const { pclose(pipe); }
    };
    const std::unique_ptr<FILE, Close> pipe(
        popen("timeout 5 systemctl --user show -p "
              "LoadState,UnitFileState,NeedDaemonReload,NoNewPrivileges,PrivateUsers,ExecMainStatus "
              "RolvaneManager.service 2>/dev/null",
              "re"));
    std::string shown;
    char part[1024];
    while (pipe && std::fgets(part, sizeof part, pipe.get())) shown += part;
    if (shown.find("LoadState=") == std::string::npos) return std::nullopt;
    return unitStateFrom(shown);
}

} // namespace rolvane::cli
