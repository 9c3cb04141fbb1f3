/*
 * main.cpp - a consumer of the installed client library: starts the
 * embedded TEE on the state directory given, lists the TA's algorithms by
 * name and generates an HMAC key, its parameters by name. Exit 0 only when both work.
 */
#include <cstdio>
#include <optional>
#include <string>

#include "km/client.h"
#include "km/embedded_tee.h"
#include "km/names.h"
#include "km/param_text.h"

int main(int argc, char **argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: consumer STATE_DIR\n");
        return 2;
    }
    km::EmbeddedTee tee(argv[1], 0);
    if (tee.open() != TEE_SUCCESS) {
        std::fprintf(stderr, "cannot open a session\n");
        return 1;
    }
    km::Client client(tee);
    km::Result<km::ValueList> algorithms = client.algorithms();
    if (!algorithms.ok()) {
        std::fprintf(stderr, "algorithms: %s\n", km::describe(algorithms.status).c_str());
        return 1;
    }
    for (uint32_t a : algorithms.value)
        std::printf("%s\n", km::enum_name(km::Enumeration::algorithm, a).c_str());
    // Parameters by name, as the installed headers give them.
    km::ParamSet params;
    for (const char *text : {"algorithm=hmac", "key_size=256", "digest=sha256", "min_mac_length=256", "purpose=sign",
                             "no_auth_required"}) {
        std::string why;
        std::optional<km::Param> p = km::parse_param(text, &why);
        if (!p) {
            std::fprintf(stderr, "%s: %s\n", text, why.c_str());
            return 1;
        }
        params.add(p->tag, p->value);
    }
    km::Result<km::Bytes> blob = client.generate_key(params);
    if (!blob.ok() || blob.value.empty()) {
        std::fprintf(stderr, "generate: %s\n", km::describe(blob.status).c_str());
        return 1;
    }
    std::printf("generated a blob of %zu bytes\n", blob.value.size());
    return 0;
}
