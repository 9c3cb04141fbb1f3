/*
 * import.cpp - `kmctl import`: a key the user holds, sealed into a blob
 * (command 19). HMAC and AES keys are raw bytes; RSA and EC keys are read
 * by OpenSSL's decoders in any form it writes by default and converted here
 * to the TA's import material.
 */
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>

#include <fcntl.h>
#include <openssl/evp.h>
#include <unistd.h>

#include "common.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "param_options.h"

namespace kmctl {
namespace {

struct ImportOptions {
    NewKeyOptions key;
    std::string in;
    std::string out;
    std::string passin;
};

// The first line of a passphrase file or descriptor, as openssl reads it.
std::string first_line(const std::string &source, int fd) {
    std::string line;
    char c = 0;
    for (;;) {
        ssize_t n = ::read(fd, &c, 1);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            throw Failure(kExitLocal, "cannot read the passphrase from " + source + ": " + std::strerror(errno));
        if (n == 0 || c == '\n')
            break;
        line += c;
    }
    if (!line.empty() && line.back() == '\r')
        line.pop_back();
    return line;
}

void check_passin(const std::string &passin) {
    static const char *const kForms[] = {"pass:", "env:", "file:", "fd:"};
    for (const char *form : kForms)
        if (passin.rfind(form, 0) == 0)
            return;
    if (passin != "stdin")
        usage_error("--passin: expected pass:TEXT, env:VAR, file:PATH, fd:N or stdin, as openssl takes it");
}

std::optional<std::string> read_passin(const std::string &passin) {
    auto rest = [&passin](size_t skip) { return passin.substr(skip); };
    if (passin.rfind("pass:", 0) == 0)
        return rest(5);
    if (passin.rfind("env:", 0) == 0) {
        const char *v = std::getenv(rest(4).c_str());
        if (!v)
            throw Failure(kExitUsage, "--passin: the environment variable " + rest(4) + " is not set");
        return std::string(v);
    }
    if (passin.rfind("file:", 0) == 0) {
        int fd = ::open(rest(5).c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0)
            throw Failure(kExitLocal, "cannot read " + rest(5) + ": " + std::strerror(errno));
        std::string line;
        try {
            line = first_line(rest(5), fd);
        } catch (...) {
            ::close(fd);
            throw;
        }
        ::close(fd);
        return line;
    }
    if (passin.rfind("fd:", 0) == 0) {
        const std::string number = rest(3);
        char *end = nullptr;
        long fd = std::strtol(number.c_str(), &end, 10);
        if (number.empty() || *end != '\0' || fd < 0 || fd > INT32_MAX)
            throw Failure(kExitUsage, "--passin: fd: takes a descriptor number");
        return first_line("descriptor " + number, static_cast<int>(fd));
    }
    if (passin == "stdin")
        return first_line("stdin", STDIN_FILENO);
    // Nothing given: ask, when there is someone at a terminal to answer.
    if (!::isatty(STDIN_FILENO))
        return std::nullopt;
    char buf[1024] = {};
    if (EVP_read_pw_string(buf, sizeof buf, "Enter the key's passphrase: ", 0) != 0)
        return std::nullopt;
    std::string pass(buf);
    explicit_bzero(buf, sizeof buf);
    return pass;
}

km::Bytes material_for(uint32_t algorithm, const km::Bytes &key, const std::string &passin) {
    std::string why;
    std::optional<km::Bytes> material;
    km::Passphrase passphrase = [&passin] { return read_passin(passin); };
    if (algorithm == KM_ALGORITHM_RSA)
        material = km::rsa_import_material(key, passphrase, &why);
    else if (algorithm == KM_ALGORITHM_EC)
        material = km::ec_import_material(key, passphrase, &why);
    else
        return key; // raw symmetric key bytes go as they are
    if (!material)
        usage_error("--in: " + why);
    return std::move(*material);
}

} // namespace

Command add_import(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<ImportOptions>();
    CLI::App *app = kmctl.add_subcommand("import", "Import a key (raw bytes for HMAC and AES; for RSA and EC a "
                                                   "private key as OpenSSL writes it, PKCS#8 or traditional, PEM or "
                                                   "DER, encrypted or not) and write its key blob");
    add_new_key_options(*app, o->key);
    add_in_option(*app, o->in, "The key to import", true);
    add_out_option(*app, o->out, "The key blob", true);
    app->add_option("--passin", o->passin,
                    "Passphrase of an encrypted key: pass:TEXT, env:VAR, file:PATH, fd:N or stdin (default: asked "
                    "on a terminal)")
        ->type_name("SOURCE");
    return {app, [o, &options] {
                if (!o->passin.empty())
                    check_passin(o->passin);
                if (o->passin == "stdin" && o->in == "-")
                    usage_error("--in and --passin cannot both read stdin");
                uint32_t algorithm = 0;
                km::ParamSet params = key_params(o->key, &algorithm, false);
                km::Bytes file = read_input(o->in);
                km::Bytes material = material_for(algorithm, file, o->passin);
                wipe(file);
                Session session(options);
                km::Result<km::ImportedKey> imported = session.client().import_key(params, material);
                wipe(material);
                km::ImportedKey key = take(std::move(imported));
                write_output(o->out, key.blob);
            }};
}

} // namespace kmctl
