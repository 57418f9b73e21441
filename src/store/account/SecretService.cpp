#include "store/account/SecretService.h"

#include "foundation/CXException.h"
#include "foundation/Mutex.h"

#include <cstdlib>
#include <libsecret/secret.h>
#include <memory>
#include <thread>
#include <unistd.h>
#include <utility>

namespace rolvane {

namespace {

constexpr int kSilentSeconds = 10;  // nobody is asked
constexpr int kPersonSeconds = 120; // somebody types
constexpr size_t kMaxBytes = 4096;

const SecretSchema& schema() {
    static const SecretSchema all = {"net.rolvane.Account",
                                     SECRET_SCHEMA_NONE,
                                     {{"program", SECRET_SCHEMA_ATTRIBUTE_STRING},
                                      {"account", SECRET_SCHEMA_ATTRIBUTE_STRING},
                                      {nullptr, SECRET_SCHEMA_ATTRIBUTE_STRING}},
                                     0,
                                     nullptr,
                                     nullptr,
                                     nullptr,
                                     nullptr,
                                     nullptr,
                                     nullptr,
                                     nullptr};
    return all;
}

template <class T>
struct Unref {
    void operator()(T* object) const { g_object_unref(object); }
};
template <class T>
using Object = std::unique_ptr<T, Unref<T>>;
struct FreeError {
    void operator()(GError* error) const { g_error_free(error); }
};
struct FreeTable {
    void operator()(GHashTable* table) const { g_hash_table_unref(table); }
};

[[noreturn]] void fail(const std::string& what, const std::string& toDo) {
    throw CXException(kCXNetworkException, what + " " + toDo);
}

constexpr const char* kOtherSource = "Log in to the desktop, or choose another source: `rolvane account set "
                                     "--ask-password` keeps the password in a file.";

// A call's own main context, time limit and connection to the service.
class Call {
public:
    explicit Call(int seconds)
        : _turn(turns()), _context(g_main_context_new()), _cancellable(g_cancellable_new()),
          _watch(g_timeout_source_new_seconds(static_cast<guint>(seconds))) {
        g_source_set_callback(
            _watch,
            [](gpointer cancellable) -> gboolean {
                g_cancellable_cancel(static_cast<GCancellable*>(cancellable));
                return G_SOURCE_REMOVE;
            },
            _cancellable.get(), nullptr);
        g_source_attach(_watch, _context);
        // libsecret waits on a context of its own, so the limit runs on another thread.
        _loop = g_main_loop_new(_context, FALSE);
        _timer = std::thread([this] { g_main_loop_run(_loop); });
    }
    ~Call() {
        _service.reset();
        secret_service_disconnect();
        _bus.reset();
        GSource* const quit = g_idle_source_new();
        g_source_set_callback(
            quit,
            [](gpointer loop) -> gboolean {
                g_main_loop_quit(static_cast<GMainLoop*>(loop));
                return G_SOURCE_REMOVE;
            },
            _loop, nullptr);
        g_source_attach(quit, _context);
        g_source_unref(quit);
        _timer.join();
        g_source_destroy(_watch);
        g_source_unref(_watch);
        g_main_loop_unref(_loop);
        g_main_context_unref(_context);
    }
    Call(const Call&) = delete;
    Call& operator=(const Call&) = delete;

    SecretService* service() {
        if (!hasBus()) fail("There is no session bus, so there is no keyring.", kOtherSource);
        // The end of the bus is no reason to end the program, which is the connection's habit.
        _bus.reset(g_bus_get_sync(G_BUS_TYPE_SESSION, _cancellable.get(), into()));
        check("The keyring cannot be asked");
        g_dbus_connection_set_exit_on_close(_bus.get(), FALSE);
        _service.reset(secret_service_get_sync(SECRET_SERVICE_OPEN_SESSION, _cancellable.get(), into()));
        check("The keyring cannot be asked");
        return _service.get();
    }
    GCancellable* cancellable() { return _cancellable.get(); }
    GError** into() {
        g_clear_error(&_error);
        return &_error;
    }
    void check(const std::string& what) {
        const std::unique_ptr<GError, FreeError> error(std::exchange(_error, nullptr));
        if (!error) return;
        if (g_error_matches(error.get(), G_IO_ERROR, G_IO_ERROR_CANCELLED))
            fail(what + ": it gave no answer in time.", kOtherSource);
        g_dbus_error_strip_remote_error(error.get());
        fail(what + ": " + error->message + ".", kOtherSource);
    }

private:
    // The libraries keep one connection and one service for the whole process.
    static Mutex& turns() {
        static auto* all = new Mutex;
        return *all;
    }
    // Without an address the bus library would start a bus of its own.
    static bool hasBus() {
        const char* address = getenv("DBUS_SESSION_BUS_ADDRESS");
        if (address && *address) return true;
        const char* directory = getenv("XDG_RUNTIME_DIR");
        return directory && *directory && access((std::string(directory) + "/bus").c_str(), F_OK) == 0;
    }

    Lock _turn;
    GMainContext* _context;
    Object<GCancellable> _cancellable;
    GSource* _watch;
    GMainLoop* _loop = nullptr;
    std::thread _timer;
    Object<GDBusConnection> _bus;
    Object<SecretService> _service;
    GError* _error = nullptr;
};

std::unique_ptr<GHashTable, FreeTable> attributesOf(const std::string& account) {
    return std::unique_ptr<GHashTable, FreeTable>(
        secret_attributes_build(&schema(), "program", "rolvane", "account", account.c_str(), nullptr));
}

} // namespace

std::string secretFromService(const std::string& account) {
    Call call(kSilentSeconds);
    SecretService* service = call.service();
    const auto attributes = attributesOf(account);
    GList* found = secret_service_search_sync(service, &schema(), attributes.get(), SECRET_SEARCH_LOAD_SECRETS,
                                              call.cancellable(), call.into());
    const std::unique_ptr<GList, void (*)(GList*)> items(found,
                                                         [](GList* list) { g_list_free_full(list, g_object_unref); });
    call.check("The keyring cannot be asked for the password of " + account);
    if (!items) fail("The keyring has no password for " + account + ".", "`rolvane setup` puts it there.");
    auto* item = static_cast<SecretItem*>(items->data);
    if (secret_item_get_locked(item))
        fail("The keyring with the password of " + account + " is locked.",
             "Unlock it, by logging in to the desktop for instance; the daemon tries again.");
    const std::unique_ptr<SecretValue, void (*)(SecretValue*)> value(secret_item_get_secret(item), [](SecretValue* v) {
        if (v) secret_value_unref(v);
    });
    gsize size = 0;
    const char* text = value ? secret_value_get(value.get(), &size) : nullptr;
    const std::string secret(text ? text : "", size);
    if (secret.empty() || size > kMaxBytes || secret.find_first_of(std::string("\r\n\0", 3)) != std::string::npos)
        fail("The keyring's entry for " + account + " holds no password.", "`rolvane setup` puts it there.");
    return secret;
}

void storeSecretInService(const std::string& account, const std::string& label, const std::string& secret) {
    Call call(kPersonSeconds);
    SecretService* service = call.service();
    const auto attributes = attributesOf(account);
    const std::unique_ptr<SecretValue, void (*)(gpointer)> value(
        secret_value_new(secret.data(), static_cast<gssize>(secret.size()), "text/plain"), secret_value_unref);
    secret_service_store_sync(service, &schema(), attributes.get(), SECRET_COLLECTION_DEFAULT, label.c_str(),
                              value.get(), call.cancellable(), call.into());
    call.check("The keyring does not take the password of " + account);
}

void removeSecretFromService(const std::string& account) {
    Call call(kPersonSeconds);
    SecretService* service = call.service();
    const auto attributes = attributesOf(account);
    secret_service_clear_sync(service, &schema(), attributes.get(), call.cancellable(), call.into());
    call.check("The keyring does not let go of the password of " + account);
}

bool secretServiceIsOpen() {
    try {
        Call call(kSilentSeconds);
        SecretService* service = call.service();
        const Object<SecretCollection> collection(secret_collection_for_alias_sync(
            service, SECRET_COLLECTION_DEFAULT, SECRET_COLLECTION_NONE, call.cancellable(), call.into()));
        call.check("The keyring cannot be asked");
        return collection && !secret_collection_get_locked(collection.get());
    } catch (const CXException&) {
        return false;
    }
}

} // namespace rolvane
