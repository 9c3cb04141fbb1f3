/*
 * characteristics.cpp - `kmctl characteristics`: a key's parameters by
 * name (commands 14 and 15). Byte strings show their length only: an
 * application id or a nonce is nobody's business on a terminal.
 */
#include <algorithm>
#include <iostream>
#include <memory>

#include <nlohmann/json.hpp>

#include "common.h"
#include "keymaster_defs.h"
#include "km/names.h"
#include "km/param_text.h"
#include "key_options.h"

namespace kmctl {
namespace {

struct CharacteristicsOptions {
    KeyOptions key;
    bool json = false;
};

// The tags in the order of their first appearance, each with all its values.
std::vector<std::pair<uint32_t, std::vector<const km::Param *>>> grouped(const km::ParamSet &set) {
    std::vector<std::pair<uint32_t, std::vector<const km::Param *>>> out;
    for (const km::Param &p : set.params()) {
        auto it = std::find_if(out.begin(), out.end(), [&](const auto &g) { return g.first == p.tag; });
        if (it == out.end())
            out.push_back({p.tag, {&p}});
        else
            it->second.push_back(&p);
    }
    return out;
}

void print_text(const km::ParamSet &set, std::ostream &out) {
    auto groups = grouped(set);
    size_t width = 0;
    for (const auto &[tag, params] : groups)
        width = std::max(width, km::tag_name(tag).size());
    for (const auto &[tag, params] : groups) {
        std::string name = km::tag_name(tag);
        std::string values;
        for (const km::Param *p : params)
            values += (values.empty() ? "" : ", ") + km::param_value_text(*p);
        out << name << std::string(width + 2 - name.size(), ' ') << values << '\n';
    }
}

nlohmann::ordered_json json_value(const km::Param &p) {
    switch (km::tag_type(p.tag)) {
    case KM_ENUM:
    case KM_ENUM_REP: {
        const km::TagInfo *info = km::find_tag(p.tag);
        std::string name = km::param_value_text(p);
        // A value without a name stays a number.
        if (info && info->values != km::Enumeration::none && name != std::to_string(p.value))
            return name;
        return p.value;
    }
    case KM_DATE:
        return km::format_date(p.value);
    case KM_BOOL:
        return p.value != 0;
    case KM_BYTES:
    case KM_BIGNUM:
        return {{"length", p.bytes.size()}};
    default:
        return p.value;
    }
}

void print_json(const km::ParamSet &set, std::ostream &out) {
    nlohmann::ordered_json json = nlohmann::ordered_json::object();
    for (const auto &[tag, params] : grouped(set)) {
        // Repeatable tags are always arrays, so that readers need not guess.
        if (km::tag_repeatable(tag) || params.size() > 1) {
            nlohmann::ordered_json values = nlohmann::ordered_json::array();
            for (const km::Param *p : params)
                values.push_back(json_value(*p));
            json[km::tag_name(tag)] = std::move(values);
        } else {
            json[km::tag_name(tag)] = json_value(*params.front());
        }
    }
    out << json.dump(2) << '\n';
}

} // namespace

Command add_characteristics(CLI::App &kmctl, const GlobalOptions &options) {
    auto o = std::make_shared<CharacteristicsOptions>();
    CLI::App *app = kmctl.add_subcommand("characteristics", "Print a key's parameters by name");
    add_key_options(*app, o->key);
    app->add_flag("--json", o->json, "Print a JSON object, one member per tag");
    return {app, [o, &options] {
                km::KeyReference key = key_reference(o->key);
                Session session(options);
                km::ParamSet chars = take(session.client().characteristics(key));
                if (o->json)
                    print_json(chars, std::cout);
                else
                    print_text(chars, std::cout);
                std::cout.flush();
                if (!std::cout)
                    throw Failure(kExitLocal, "cannot write stdout");
            }};
}

} // namespace kmctl
