/*
 * info.cpp - `kmctl info`: what the TA supports, from commands 1 to 12.
 */
#include <iostream>
#include <memory>

#include <nlohmann/json.hpp>

#include "common.h"
#include "keymaster_defs.h"
#include "km/names.h"

namespace kmctl {
namespace {

struct PurposeSupport {
    uint32_t purpose;
    km::ValueList block_modes;
    km::ValueList paddings;
    km::ValueList digests;
};

struct AlgorithmSupport {
    uint32_t algorithm;
    std::vector<PurposeSupport> purposes; // only those the algorithm supports
    km::ValueList import_formats;
    km::ValueList export_formats;
};

std::vector<AlgorithmSupport> query(km::Client &client) {
    std::vector<AlgorithmSupport> out;
    for (uint32_t algorithm : take(client.algorithms())) {
        AlgorithmSupport a{algorithm, {}, {}, {}};
        for (const km::EnumName &p : km::enum_names(km::Enumeration::purpose)) {
            km::Result<km::ValueList> modes = client.block_modes(algorithm, p.value);
            // A purpose the algorithm lacks is not a failure of the query.
            if (modes.status.refused() && modes.status.km == KM_ERROR_UNSUPPORTED_PURPOSE)
                continue;
            PurposeSupport s{p.value, take(std::move(modes)), {}, {}};
            s.paddings = take(client.paddings(algorithm, p.value));
            s.digests = take(client.digests(algorithm, p.value));
            a.purposes.push_back(std::move(s));
        }
        a.import_formats = take(client.import_formats(algorithm));
        a.export_formats = take(client.export_formats(algorithm));
        out.push_back(std::move(a));
    }
    return out;
}

std::string join(km::Enumeration e, const km::ValueList &values) {
    if (values.empty())
        return "-";
    std::string s;
    for (uint32_t v : values) {
        if (!s.empty())
            s += ", ";
        s += km::enum_name(e, v);
    }
    return s;
}

void print_table(const std::vector<AlgorithmSupport> &support, std::ostream &out) {
    constexpr size_t kLabelWidth = 21; // "decrypt block modes" and two spaces
    auto row = [&out](const std::string &label, const std::string &values) {
        out << "  " << label << std::string(kLabelWidth - label.size(), ' ') << values << '\n';
    };
    bool first = true;
    for (const AlgorithmSupport &a : support) {
        if (!first)
            out << '\n';
        first = false;
        out << km::enum_name(km::Enumeration::algorithm, a.algorithm) << '\n';
        for (const PurposeSupport &p : a.purposes) {
            std::string purpose = km::enum_name(km::Enumeration::purpose, p.purpose);
            row(purpose + " block modes", join(km::Enumeration::block_mode, p.block_modes));
            row(purpose + " paddings", join(km::Enumeration::padding, p.paddings));
            row(purpose + " digests", join(km::Enumeration::digest, p.digests));
        }
        row("import formats", join(km::Enumeration::key_format, a.import_formats));
        row("export formats", join(km::Enumeration::key_format, a.export_formats));
    }
}

nlohmann::ordered_json json_list(km::Enumeration e, const km::ValueList &values) {
    nlohmann::ordered_json list = nlohmann::ordered_json::array();
    for (uint32_t v : values)
        list.push_back(km::enum_name(e, v));
    return list;
}

void print_json(const std::vector<AlgorithmSupport> &support, std::ostream &out) {
    nlohmann::ordered_json algorithms = nlohmann::ordered_json::array();
    for (const AlgorithmSupport &a : support) {
        nlohmann::ordered_json purposes = nlohmann::ordered_json::object();
        for (const PurposeSupport &p : a.purposes)
            purposes[km::enum_name(km::Enumeration::purpose, p.purpose)] = {
                {"block_modes", json_list(km::Enumeration::block_mode, p.block_modes)},
                {"paddings", json_list(km::Enumeration::padding, p.paddings)},
                {"digests", json_list(km::Enumeration::digest, p.digests)},
            };
        algorithms.push_back({
            {"name", km::enum_name(km::Enumeration::algorithm, a.algorithm)},
            {"value", a.algorithm},
            {"purposes", std::move(purposes)},
            {"import_formats", json_list(km::Enumeration::key_format, a.import_formats)},
            {"export_formats", json_list(km::Enumeration::key_format, a.export_formats)},
        });
    }
    nlohmann::ordered_json json = {{"algorithms", std::move(algorithms)}};
    out << json.dump(2) << '\n';
}

} // namespace

Command add_info(CLI::App &kmctl, const GlobalOptions &options) {
    auto as_json = std::make_shared<bool>(false);
    CLI::App *app = kmctl.add_subcommand(
        "info", "List the algorithms the TA supports with their block modes, paddings, digests and key formats");
    app->add_flag("--json", *as_json, "Print a JSON object instead of a table");
    return {app, [as_json, &options] {
                Session session(options);
                std::vector<AlgorithmSupport> support = query(session.client());
                if (*as_json)
                    print_json(support, std::cout);
                else
                    print_table(support, std::cout);
                std::cout.flush();
                if (!std::cout)
                    throw Failure(kExitLocal, "cannot write stdout");
            }};
}

} // namespace kmctl
