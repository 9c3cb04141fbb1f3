/*
 * characteristics.cpp - `kmctl characteristics`: a key's parameters by
 * name (commands 14 and 15). Byte strings show their length only: an
 * application id or a nonce is nobody's business on a terminal.
 */
#include <algorithm>
#include <iostream>
#include <memory>

#include "common.h"
#include "json.h"
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

void json_value(JsonWriter &json, const km::Param &p) {
    switch (km::tag_type(p.tag)) {
    case KM_ENUM:
    case KM_ENUM_REP: {
        const km::TagInfo *info = km::find_tag(p.tag);
        std::string name = km::param_value_text(p);
        // A value without a name stays a number.
        if (info && info->values != km::Enumeration::none && name != std::to_string(p.value))
            json.value(name);
        else
            json.value(p.value);
        break;
    }
    case KM_DATE:
        json.value(km::format_date(p.value));
        break;
    case KM_BOOL:
        json.value(p.value != 0);
        break;
    case KM_BYTES:
    case KM_BIGNUM:
        json.begin_object().key("length").value(uint64_t{p.bytes.size()}).end_object();
        break;
    default:
        json.value(p.value);
        break;
    }
}

void print_json(const km::ParamSet &set, std::ostream &out) {
    JsonWriter json(out);
    json.begin_object();
    for (const auto &[tag, params] : grouped(set)) {
        json.key(km::tag_name(tag));
        // Repeatable tags are always arrays, so that readers need not guess.
        bool array = km::tag_repeatable(tag) || params.size() > 1;
        if (array)
            json.begin_array(true);
        for (const km::Param *p : params)
            json_value(json, *p);
        if (array)
            json.end_array();
    }
    json.end_object();
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
