#include "contacts/VCardReader.h"

#include "contacts/CXMultiValue.h"
#include "contacts/Constants.h"
#include "contacts/VCardFields.h"
#include "contacts/VCardLabels.h"
#include "contacts/VCardText.h"
#include "foundation/CXException.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <map>

namespace rolvane {

namespace {

// Extension properties that name the custom label of the other property of their group: X-...LABEL.
bool isLabelLine(const VCardLine& line) {
    return !line.group.empty() && line.name.starts_with("X-") && line.name.ends_with("LABEL");
}

bool isKindLine(const VCardLine& line) {
    return line.name == "KIND" || (line.name.starts_with("X-") && line.name.ends_with("-KIND"));
}

bool isMemberLine(const VCardLine& line) {
    return line.name == "MEMBER" || (line.name.starts_with("X-") && line.name.ends_with("-MEMBER"));
}

constexpr std::pair<const char*, const char*> kTextLines[] = {
    {"FN", kCXFormattedNameProperty},
    {"NOTE", kCXNoteProperty},
    {"TITLE", kCXJobTitleProperty},
    {"X-ROLVANE-MAIDEN-NAME", kCXMaidenNameProperty},
    {"X-MAIDENNAME", kCXMaidenNameProperty},
    {"X-ROLVANE-PHONETIC-FIRST", kCXFirstNamePhoneticProperty},
    {"X-PHONETIC-FIRST-NAME", kCXFirstNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-MIDDLE", kCXMiddleNamePhoneticProperty},
    {"X-PHONETIC-MIDDLE-NAME", kCXMiddleNamePhoneticProperty},
    {"X-ROLVANE-PHONETIC-LAST", kCXLastNamePhoneticProperty},
    {"X-PHONETIC-LAST-NAME", kCXLastNamePhoneticProperty},
};

const char* textPropertyFor(std::string_view name) {
    for (const auto& [line, property] : kTextLines)
        if (name == line) return property;
    return nullptr;
}

// Properties that no file may set: they say with whom something is shared.
bool isForbidden(std::string_view property) {
    return property == kCXRemoteLocationProperty || property == kCXReadSharingACLProperty ||
           property == kCXReadWriteSharingACLProperty;
}

int preferenceOf(const VCardLine& line) {
    const VCardParameter* p = line.parameter("PREF");
    if (p && !p->values.empty()) {
        int n = std::atoi(p->values.front().c_str());
        return n >= 1 && n <= 100 ? n : 100;
    }
    return line.hasType("pref") ? 1 : 1000;
}

class Reader {
public:
    Reader(const VCard& card, VCardError& error) : _card(card), _error(error) {}

    std::optional<VCardEntity> read() {
        _entity.line = _card.firstLine;
        studyGroups();
        for (const auto& line : _card.lines)
            if (!take(line)) return std::nullopt;
        storeMultiValues();
        if (!applyExactValues()) return std::nullopt;
        finishNames();
        if (_entity.isGroup && !_entity.properties[kCXGroupNameProperty])
            return bad(_card.firstLine, "the group has no name (FN)");
        bool nothing =
            _entity.properties.empty() && _extras.empty() && _entity.categories.empty() && _entity.uid.empty();
        if (nothing) return bad(_card.firstLine, "the card is empty");
        storeExtras();
        return std::move(_entity);
    }

private:
    struct Entry {
        int preference;
        std::string label;
        Value value;
    };

    std::nullopt_t bad(size_t line, std::string reason) {
        _error.line = line;
        _error.reason = std::move(reason);
        return std::nullopt;
    }

    // Custom labels, how many lines a group name holds together, and whether this is a group's card.
    void studyGroups() {
        for (const auto& line : _card.lines) {
            if (isLabelLine(line))
                _labels.emplace(line.group, vcardUnescape(line.value));
            else if (!line.group.empty())
                _groupUse[line.group]++;
            if (isKindLine(line) && vcardEqualNoCase(vcardTrim(line.value), "group")) _entity.isGroup = true;
        }
    }

    bool take(const VCardLine& line) {
        if (isLabelLine(line) && _groupUse.count(line.group)) return true;
        if (line.name == "PRODID" || line.name == "REV") return true; // of the file that was, not of the person
        if (line.name == "UID") return takeUID(line);
        if (isKindLine(line)) return takeKind(line);
        if (line.name == "X-ROLVANE-VALUE") return takeExactValue(line);
        if (_entity.isGroup && takeOfGroup(line)) return true;
        if (line.name == "PHOTO") return takePhoto(line);
        if (line.name == "CATEGORIES") {
            auto names = vcardDecodeList(line);
            _entity.categories.insert(_entity.categories.end(), names.begin(), names.end());
            return true;
        }
        if (!takeMulti(line) && !takeSingle(line)) keep(line);
        return true;
    }

    bool takeUID(const VCardLine& line) {
        std::string uid(vcardTrim(vcardUnescape(line.value)));
        if (uid.empty()) return true;
        if (!_entity.uid.empty()) return true; // a card has one, and the first is it
        _entity.uid = uid;
        if (!line.parameters.empty() || uid != vcardUIDForUUID(vcardUUIDForUID(uid))) keep(line);
        return true;
    }

    bool takeKind(const VCardLine& line) {
        std::string kind = vcardLower(vcardTrim(line.value));
        if (kind == "org" || kind == "organization")
            _entity.properties.set(kCXIsCompanyProperty, true);
        else if (kind != "group" && kind != "individual")
            keep(line);
        return true;
    }

    bool takeOfGroup(const VCardLine& line) {
        if (line.name == "X-ROLVANE-SUBGROUP")
            return _entity.subgroups.emplace_back(vcardTrim(vcardUnescape(line.value))), true;
        if (isMemberLine(line)) return _entity.members.emplace_back(vcardTrim(vcardUnescape(line.value))), true;
        if (line.name == "X-ROLVANE-CHOICE") {
            _entity.choices.push_back({line.firstValueOf("X-MEMBER"), line.firstValueOf("X-PROPERTY"),
                                       line.firstValueOf("X-LABEL"), line.value});
            return true;
        }
        bool names = line.name == "FN" || (line.name == "N" && !_entity.properties[kCXGroupNameProperty]);
        if (!names) return line.name == "N";
        std::string name =
            line.name == "FN" ? vcardUnescape(line.value) : vcardUnescape(vcardSplit(line.value, ';')[0]);
        if (!vcardTrim(name).empty()) _entity.properties.set(kCXGroupNameProperty, name);
        return true;
    }

    bool takePhoto(const VCardLine& line) {
        std::string reason;
        auto photo = vcardDecodePhoto(line, reason);
        if (!reason.empty()) return bad(line.number, reason), false;
        bool usable = photo && !photo->bytes.empty() && !_entity.properties[kCXPhotoProperty] && !_entity.isGroup;
        if (!usable) {
            if (!line.value.empty()) keep(line);
            return true;
        }
        _entity.properties.set(kCXPhotoProperty, std::move(photo->bytes));
        if (!photo->mediaType.empty()) _entity.properties.set(kCXPhotoTypeProperty, photo->mediaType);
        return true;
    }

    bool takeMulti(const VCardLine& line) {
        if (_entity.isGroup) return false;
        auto custom = line.group.empty() ? _labels.end() : _labels.find(line.group);
        bool labelled = custom != _labels.end();
        const VCardMultiField* field = vcardMultiFieldForLine(line.name, labelled);
        if (!field) return false;
        if (line.name == "URL" && line.parameter("X-ROLVANE-HOMEPAGE")) {
            _entity.properties.set(kCXHomePageProperty, vcardUnescape(line.value));
            return true;
        }
        Value value = vcardDecodeMultiValue(field->property, line);
        if (!value) return vcardTrim(line.value).empty();
        std::string label = labelled                             ? custom->second
                            : line.name.ends_with("ANNIVERSARY") ? kCXAnniversaryLabel
                                                                 : vcardLabelForTypes(field->lineName, line.types());
        carry(line, *field, label, value);
        _multi[field->property].push_back({preferenceOf(line), std::move(label), std::move(value)});
        return true;
    }

    // Keeps what the value and its label do not say.
    void carry(const VCardLine& line, const VCardMultiField& field, const std::string& label, const Value& value) {
        VCardLine carrier;
        carrier.name = field.lineName;
        auto types = line.types();
        bool needed = keptGroup(line) || vcardTypesAddToLabel(field.lineName, label, types);
        int preference = preferenceOf(line);
        for (const auto& t : types)
            if (t != "pref" && !t.empty()) carrier.add("TYPE", t);
        for (const auto& p : line.parameters) {
            bool said = p.name == "TYPE" || p.name == "VALUE" || p.name == "ENCODING" || p.name == "PREF" ||
                        p.name == "X-ROLVANE-LABEL" ||
                        (p.name == "CC" && field.property == std::string_view(kCXAddressProperty));
            if (said) continue;
            carrier.parameters.push_back(p);
            needed = true;
        }
        if (preference < 1000) carrier.add("PREF", std::to_string(preference)), needed = true;
        auto raw = needed ? vcardEncodeMultiValue(field.property, value) : std::nullopt;
        if (!raw) return;
        if (keptGroup(line)) carrier.group = line.group;
        carrier.add("X-ROLVANE-LABEL", label);
        carrier.value = *raw;
        _extras.push_back("+" + vcardFormatLine(carrier));
    }

    // The group name holds the line together with others that are not just its label.
    bool keptGroup(const VCardLine& line) const {
        auto use = line.group.empty() ? _groupUse.end() : _groupUse.find(line.group);
        return use != _groupUse.end() && use->second > 1;
    }

    bool takeSingle(const VCardLine& line) {
        if (_entity.isGroup && line.name != "NOTE") return false;
        Dictionary& p = _entity.properties;
        bool empty = vcardTrim(line.value).empty();
        auto once = [&](bool taken) { return empty || (!taken && _seen.insert({line.name, &line}).second); };
        if (line.name == "N") {
            if (!once(_seen.count("N"))) return false;
            vcardDecodeName(line, p);
            return carrySingle(line), true;
        }
        if (line.name == "ORG") {
            if (!once(_seen.count("ORG"))) return false;
            vcardDecodeOrganization(line, p);
            return carrySingle(line), true;
        }
        if (line.name == "NICKNAME") {
            if (!once(_seen.count("NICKNAME"))) return false;
            std::string all;
            for (const auto& n : vcardDecodeList(line)) (all += all.empty() ? "" : ", ") += n;
            if (!all.empty()) p.set(kCXNicknameProperty, all);
            return carrySingle(line), true;
        }
        if (line.name == "BDAY") return once(_seen.count("BDAY")) && takeBirthday(line, empty);
        const char* property = textPropertyFor(line.name);
        if (!property) return false;
        if (empty) return true;
        if (p[property]) return false;
        p.set(property, vcardUnescape(line.value));
        _seen.insert({line.name, &line});
        return carrySingle(line), true;
    }

    bool takeBirthday(const VCardLine& line, bool empty) {
        if (empty) return true;
        bool isText = vcardEqualNoCase(line.firstValueOf("VALUE"), "text");
        auto date = isText ? std::nullopt : vcardDecodeDate(line.value);
        if (date)
            _entity.properties.set(kCXBirthdayProperty, *date);
        else
            _entity.properties.set(kCXBirthdayTextProperty, vcardUnescape(line.value));
        return true;
    }

    // The value of such a line is written anew, so its carrier is finished when all is read: see storeExtras.
    void carrySingle(const VCardLine& line) {
        bool needed = keptGroup(line);
        for (const auto& p : line.parameters) needed = needed || (p.name != "VALUE" && p.name != "ENCODING");
        if (needed) _singleCarriers.push_back(&line);
    }

    bool takeExactValue(const VCardLine& line) {
        std::string name = line.firstValueOf("X-NAME");
        if (name.empty() || isForbidden(name)) return true;
        _exact.push_back({name, &line});
        return true;
    }

    bool applyExactValues() {
        for (const auto& [name, line] : _exact) {
            _entity.properties.remove(name);
            if (line->value.empty()) continue;
            auto bytes = vcardDecodeBase64(line->value);
            if (!bytes) return bad(line->number, "the base64 of the property " + name + " is damaged"), false;
            try {
                _entity.properties.set(name, BinaryValue::decode(*bytes));
            } catch (const CXException& e) {
                return bad(line->number, "the value of the property " + name + " is damaged: " + e.reason()), false;
            }
        }
        return true;
    }

    void storeMultiValues() {
        for (auto& [property, entries] : _multi) {
            std::stable_sort(entries.begin(), entries.end(),
                             [](const Entry& a, const Entry& b) { return a.preference < b.preference; });
            CXMutableMultiValue multi;
            for (auto& e : entries) multi.addValue(std::move(e.value), e.label);
            _entity.properties.set(property, multi.toValue());
        }
    }

    // A formatted name is a property of its own only where it says something else than the parts.
    void finishNames() {
        Dictionary& p = _entity.properties;
        if (isExact(kCXFormattedNameProperty)) return;
        if (p[kCXFormattedNameProperty] && p[kCXFormattedNameProperty].string() == vcardDerivedFormattedName(p))
            p.remove(kCXFormattedNameProperty);
    }

    bool isExact(std::string_view property) const {
        return std::any_of(_exact.begin(), _exact.end(), [&](const auto& e) { return e.first == property; });
    }

    std::string writtenValue(const VCardLine& line) const {
        const Dictionary& p = _entity.properties;
        if (line.name == "N") return vcardEncodeName(p);
        if (line.name == "ORG") return vcardEncodeOrganization(p);
        return vcardEscape(vcardUnescape(line.value));
    }

    void storeExtras() {
        for (const VCardLine* line : _singleCarriers) {
            VCardLine carrier;
            if (keptGroup(*line)) carrier.group = line->group;
            carrier.name = line->name;
            for (const auto& p : line->parameters)
                if (p.name != "VALUE" && p.name != "ENCODING") carrier.parameters.push_back(p);
            carrier.value = line->name == "NICKNAME" ? vcardEncodeList(vcardDecodeList(*line)) : writtenValue(*line);
            _extras.push_back("+" + vcardFormatLine(carrier));
        }
        if (_extras.empty()) return;
        std::sort(_extras.begin(), _extras.end());
        _extras.erase(std::unique(_extras.begin(), _extras.end()), _extras.end());
        Array all;
        all.reserve(_extras.size());
        for (auto& e : _extras) all.append(std::move(e));
        _entity.properties.set(kCXVCardExtraProperty, all);
    }

    void keep(const VCardLine& line) { _extras.push_back(vcardFormatLine(line)); }

    const VCard& _card;
    VCardError& _error;
    VCardEntity _entity;
    std::map<std::string, std::string, std::less<>> _labels; // group name -> custom label
    std::map<std::string, int, std::less<>> _groupUse;       // group name -> lines that are no labels
    std::map<std::string, std::vector<Entry>, std::less<>> _multi;
    std::map<std::string, const VCardLine*, std::less<>> _seen;
    std::vector<std::pair<std::string, const VCardLine*>> _exact;
    std::vector<const VCardLine*> _singleCarriers;
    std::vector<std::string> _extras;
};

} // namespace

std::optional<VCardEntity> vcardEntityFromCard(const VCard& card, VCardError& error) {
    return Reader(card, error).read();
}

std::string vcardUIDForUUID(std::string_view uuid) {
    return "urn:uuid:" + std::string(uuid);
}

} // namespace rolvane
