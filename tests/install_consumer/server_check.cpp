// What a relying server builds against the installed verifier: it reads a
// public key and checks a statement, needing no TEE. Usage: server_check
// PUBKEY STATEMENT; prints the verdict.
#include <cstdio>
#include <fstream>
#include <iterator>
#include <vector>

#include <soter/verifier.h>

int main(int argc, char **argv) {
    if (argc != 3)
        return 2;
    std::ifstream k(argv[1], std::ios::binary), s(argv[2], std::ios::binary);
    std::vector<std::uint8_t> key((std::istreambuf_iterator<char>(k)), std::istreambuf_iterator<char>());
    std::vector<std::uint8_t> statement((std::istreambuf_iterator<char>(s)), std::istreambuf_iterator<char>());
    soter::ExportVerdict v = soter::verify_export_output(statement, soter::load_public_key(key));
    std::printf("%s\n", v.valid() ? "valid" : soter::check_name(v.failed));
    return v.valid() ? 0 : 1;
}
