#include "contacts/vcard/VCardReader.h"

#include "contacts/records/CXMultiValue.h"
#include "contacts/records/Constants.h"
#include "contacts/vcard/VCardFields.h"
#include "contacts/vcard/VCardKept.h"
#include "contacts/vcard/VCardLabels.h"
#include "contacts/vcard/VCardText.h"
#include "foundation/CXException.h"
#include "foundation/PropertyList.h"

#include <algorithm>
#include <cstdio>
#include <iterator>
#include <map>
#include <set>

namespace rolvane {

namespace {

bool isKindLine(const VCardLine& line) {
    return line.name == "KIND" || (line.name.starts_with("X-") && line.name.ends_with("-KIND"));
}

bool isMemberLine(const VCardLine& line) {
    return line.name == "MEMBER" || (line.name.starts_with("X-") && line.name.ends_with("-MEMBER"));
}

constexpr int kNoPreference = 1000;

int preferenceOf(const VCardLine& line) {
    const VCardParameter* p = line.parameter("PREF");
    if (p && !p->values.empty()) {
        int n = std::atoi(p->values.front().c_str());
        return n >= 1 && n <= 100 ? n : 100;
    }
    return line.hasType("pref") ? 1 : kNoPreference;
}

class Reader {
public:
    Reader(const VCard& card, VCardError& error) : _card(card), _error(error) {}

    std::optional<VCardEntity> read() {
        _entity.line = _card.firstLine;
        _entity.notices = _card.notices;
        studyGroups();
        for (const auto& line : _card.lines)
            if (!take(line)) return std::nullopt;
        keepUnusedLabels();
        storeMultiValues();
        applyExactValues();
        finishNames();
        if (_entity.isGroup && !_entity.properties[kCXGroupNameProperty])
            return bad(_card.firstLine, "the group has no name (FN)");
        bool nothing =
            _entity.properties.empty() && _extras.empty() && _entity.categories.empty() && _entity.uid.empty();
        if (nothing) return bad(_card.firstLine, "the card is empty");
        if (!_entity.notices.empty() && isAllUnread())
            return bad(_entity.notices.front().line, _entity.notices.front().reason);
        storeExtras();
        return std::move(_entity);
    }

private:
    struct Entry {
        int preference;
        std::string label;
        Value value;
    };

    // A line whose parameters and group may have to be kept.
    struct MultiCarrier {
        const VCardLine* line;
        const VCardMultiField* field;
        std::string label;
        Value value;
    };

    struct ListCarrier {
        const VCardLine* line;
        const char* writtenName;
        std::string value;
    };

    std::nullopt_t bad(size_t line, std::string reason) {
        _error.line = line;
        _error.reason = std::move(reason);
        return std::nullopt;
    }

    // Custom labels, and whether this is a group's card.
    void studyGroups() {
        for (const auto& line : _card.lines) {
            if (vcardIsLabelLine(line) && !saysNothing(line)) _labels.emplace(line.group, labelIn(line));
            if (isKindLine(line) && vcardEqualNoCase(vcardTrim(line.value), "group")) _entity.isGroup = true;
        }
    }

    static std::string labelIn(const VCardLine& line) {
        std::string text = vcardUnescape(line.value);
        return line.name == "X-ABLABEL" ? vcardLabelFromText(text) : text;
    }

    // Many programs write empty labels. Only ours means it.
    static bool saysNothing(const VCardLine& label) {
        return label.name != "X-ROLVANE-LABEL" && vcardTrim(label.value).empty();
    }

    bool isAllUnread() const {
        if (!_entity.properties.empty() || !_entity.categories.empty() || !_entity.uid.empty()) return false;
        return std::all_of(_extras.begin(), _extras.end(),
                           [](const std::string& e) { return e.starts_with(kVCardUnreadLine); });
    }

    // Keeps a line whose value is damaged as it stands, under a name that says so.
    void keepUnread(const VCardLine& line, std::string reason) {
        VCardLine kept;
        kept.name = kVCardUnreadLine;
        kept.value = vcardEscape(vcardFormatLine(line));
        keep(kept);
        _entity.notices.push_back({line.number, std::move(reason)});
    }

    bool take(const VCardLine& line) {
        if (vcardIsLabelLine(line)) return _labelLines.push_back(&line), true;
        if (line.name == "PRODID" || line.name == "REV") return true; // of the file that was, not of the person
        if (line.name == "PROFILE" && vcardEqualNoCase(vcardTrim(line.value), "VCARD")) return true;
        if (line.name == "UID") return takeUID(line);
        if (isKindLine(line)) return takeKind(line);
        if (line.name == "X-ROLVANE-VALUE") return takeExactValue(line);
        if (line.name == "X-ROLVANE-KEPT") return takeKept(line);
        if (_entity.isGroup && takeOfGroup(line)) return true;
        if (line.name == "PHOTO") return takePhoto(line);
        if (line.name == "CATEGORIES" && !_entity.isGroup) {
            return takeCategories(line);
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
        const bool company = kind == "org" || kind == "organization";
        if (company) _entity.properties.set(kCXIsCompanyProperty, true);
        if (!company && kind != "group" && kind != "individual") return keep(line), true;
        if (!saysMore(line)) return true;
        if (!_seen.insert("KIND").second) return keep(line), true;
        return carrySingle(line, "KIND");
    }

    // A name is said once; a line that says nothing but names that were said is kept for what else is in it.
    bool takeCategories(const VCardLine& line) {
        std::vector<std::string> fresh;
        for (auto& name : vcardDecodeList(line))
            if (!name.empty() && _categories.insert(name).second) fresh.push_back(std::move(name));
        if (fresh.empty()) {
            if (saysMore(line)) keep(line);
            return true;
        }
        use(line.group);
        if (saysMore(line)) _listCarriers.push_back({&line, "CATEGORIES", vcardEncodeList(fresh)});
        std::move(fresh.begin(), fresh.end(), std::back_inserter(_entity.categories));
        return true;
    }

    bool takeMember(const VCardLine& line, std::vector<std::string>& members) {
        members.emplace_back(vcardTrim(vcardUnescape(line.value)));
        use(line.group);
        if (saysMore(line)) _listCarriers.push_back({&line, "MEMBER", vcardMemberKey(members.back())});
        return true;
    }

    bool takeOfGroup(const VCardLine& line) {
        if (line.name == "X-ROLVANE-SUBGROUP") return takeMember(line, _entity.subgroups);
        if (isMemberLine(line)) return takeMember(line, _entity.members);
        if (line.name == "X-ROLVANE-CHOICE") {
            _entity.choices.push_back({line.firstValueOf("X-MEMBER"), line.firstValueOf("X-PROPERTY"),
                                       line.firstValueOf("X-LABEL"), line.value});
            return true;
        }
        if (line.name == "FN") return takeGroupName(line);
        if (line.name != "N") return false;
        std::string name = vcardUnescape(vcardSplit(line.value, ';')[0]);
        bool needed = !_entity.properties[kCXGroupNameProperty] && !vcardTrim(name).empty();
        if (needed) _entity.properties.set(kCXGroupNameProperty, name);
        return true;
    }

    bool takeGroupName(const VCardLine& line) {
        std::string name = vcardUnescape(line.value);
        if (vcardTrim(name).empty()) return true;
        if (!_seen.insert(line.name).second) return false;
        _entity.properties.set(kCXGroupNameProperty, name);
        return carrySingle(line, line.name);
    }

    // A line that would mean something else if it stood for itself. Which card it is and whose cannot be said in it.
    bool takeKept(const VCardLine& line) {
        std::string text = vcardUnescape(line.value);
        auto inner = vcardParseLine(text);
        bool usable = inner && vcardIsPlainText(text) && !inner->isStillEncoded();
        for (const char* name : {"BEGIN", "END", "VERSION", "UID", "X-ROLVANE-KEPT"})
            usable = usable && inner->name != name;
        keep(usable ? *inner : line);
        return true;
    }

    bool takePhoto(const VCardLine& line) {
        std::string reason;
        auto photo = vcardDecodePhoto(line, reason);
        if (!reason.empty()) return keepUnread(line, reason), true;
        bool usable = photo && !photo->bytes.empty() && !_entity.properties[kCXPhotoProperty] && !_entity.isGroup;
        if (!usable) {
            if (!line.value.empty()) keep(line);
            return true;
        }
        _entity.properties.set(kCXPhotoProperty, std::move(photo->bytes));
        if (!photo->mediaType.empty()) _entity.properties.set(kCXPhotoTypeProperty, photo->mediaType);
        return carrySingle(line, line.name);
    }

    bool takeMulti(const VCardLine& line) {
        if (_entity.isGroup) return false;
        auto custom = line.group.empty() ? _labels.end() : _labels.find(line.group);
        bool labelled = custom != _labels.end();
        const VCardMultiField* field = vcardMultiFieldForLine(line.name, labelled);
        if (!field) return false;
        if (line.name == "URL" && line.parameter("X-ROLVANE-HOMEPAGE")) return takeHomePage(line);
        Value value = vcardDecodeMultiValue(field->property, line);
        if (!value) return vcardTrim(line.value).empty();
        std::string label = labelled                             ? custom->second
                            : line.name.ends_with("ANNIVERSARY") ? kCXAnniversaryLabel
                                                                 : vcardLabelForTypes(field->lineName, line.types());
        if (labelled) _usedLabels.insert(line.group);
        use(line.group);
        if (saysMore(line)) _multiCarriers.push_back({&line, field, label, value});
        _multi[field->property].push_back({preferenceOf(line), std::move(label), std::move(value)});
        return true;
    }

    bool takeHomePage(const VCardLine& line) {
        std::string address = vcardUnescape(line.value);
        if (vcardTrim(address).empty()) return true;
        if (_entity.properties[kCXHomePageProperty]) return false;
        _entity.properties.set(kCXHomePageProperty, address);
        return true;
    }

    bool takeSingle(const VCardLine& line) {
        if (_entity.isGroup && line.name != "NOTE") return false;
        const char* property = vcardTextPropertyForLine(line.name);
        if (property) return takeText(line, property, vcardLineForTextProperty(property));
        if (line.name == "FN") return takeText(line, kCXFormattedNameProperty, "FN");
        Dictionary said;
        if (line.name == "N")
            vcardDecodeName(line, said);
        else if (line.name == "ORG")
            vcardDecodeOrganization(line, said);
        else if (line.name == "NICKNAME")
            vcardDecodeNickname(line, said);
        else if (line.name == "BDAY")
            decodeBirthday(line, said);
        else
            return false;
        if (said.empty()) return vcardSurplusParts(line).empty();
        if (!_seen.insert(line.name).second) return false;
        for (const auto& [key, value] : said) _entity.properties.set(key, value);
        return carrySingle(line, line.name);
    }

    bool takeText(const VCardLine& line, const char* property, const char* writtenName) {
        if (vcardTrim(line.value).empty()) return true;
        if (_entity.properties[property]) return false;
        _entity.properties.set(property, vcardUnescape(line.value));
        return carrySingle(line, writtenName);
    }

    static void decodeBirthday(const VCardLine& line, Dictionary& said) {
        if (vcardTrim(line.value).empty()) return;
        bool isText = vcardEqualNoCase(line.firstValueOf("VALUE"), "text");
        const std::string day = vcardDayOfYear(vcardTrim(line.value));
        const int filling = day.empty() ? 0 : vcardOmittedYear(line);
        char full[16] = "";
        if (filling > 0) std::snprintf(full, sizeof full, "%04d%s", filling, day.substr(2).c_str());
        auto date = isText ? std::nullopt : vcardDecodeDate(filling > 0 ? std::string(full) : line.value);
        if (date)
            said.set(kCXBirthdayProperty, *date);
        else
            said.set(kCXBirthdayTextProperty, day.empty() ? vcardUnescape(line.value) : day);
    }

    // The value of such a line is written anew, so its carrier is finished when all is read.
    bool carrySingle(const VCardLine& line, std::string writtenName) {
        use(line.group);
        if (saysMore(line)) _singleCarriers.emplace_back(&line, std::move(writtenName));
        return true;
    }

    static bool saysMore(const VCardLine& line) {
        return !line.group.empty() || !line.parameters.empty() || !vcardSurplusParts(line).empty() ||
               !vcardListedName(line).empty();
    }

    // Parameters of any line that are used up or written anew.
    static bool isSpent(const VCardParameter& p) {
        return p.name == "VALUE" || p.name == "ENCODING" || p.name == "X-ROLVANE-REST" || p.name == "X-ROLVANE-RAW";
    }

    // How many written lines a group name holds together, their labels aside.
    void use(const std::string& group) {
        if (!group.empty()) _groupUse[group]++;
    }

    // The group name holds the line together with others that are not just its label.
    bool keptGroup(const VCardLine& line) const {
        auto use = line.group.empty() ? _groupUse.end() : _groupUse.find(line.group);
        return use != _groupUse.end() && use->second > 1;
    }

    // Labels of nothing that has one, and further labels of what has one already.
    void keepUnusedLabels() {
        for (const VCardLine* line : _labelLines) {
            bool said = _usedLabels.count(line->group) && _labels[line->group] == labelIn(*line);
            if (!said && !saysNothing(*line)) keep(*line);
        }
    }

    bool takeExactValue(const VCardLine& line) {
        std::string name = line.firstValueOf("X-NAME");
        if (name.empty() || vcardIsNeverExact(name)) return true;
        _exact.push_back({name, &line});
        return true;
    }

    void applyExactValues() {
        std::erase_if(_exact, [&](const auto& exact) {
            const auto& [name, line] = exact;
            Value value;
            try {
                auto bytes = vcardDecodeBase64(line->value);
                if (!bytes) return keepUnread(*line, "the base64 of the property " + name + " is damaged"), true;
                if (!bytes->empty()) value = BinaryValue::decode(*bytes);
            } catch (const CXException& e) {
                return keepUnread(*line, "the value of the property " + name + " is damaged: " + e.reason()), true;
            }
            _entity.properties.remove(name);
            if (value) _entity.properties.set(name, std::move(value));
            return false;
        });
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

    void finishSingleCarriers() {
        for (const auto& [line, name] : _singleCarriers) {
            VCardLine carrier;
            if (keptGroup(*line)) carrier.group = line->group;
            carrier.name = name;
            for (const auto& p : line->parameters)
                if (!isSpent(p) && !(name == "PHOTO" && p.name == "TYPE")) carrier.parameters.push_back(p);
            addSurplus(*line, carrier);
            if (carrier.group.empty() && carrier.parameters.empty()) continue;
            carrier.value = vcardEncodeSingle(name, _entity.properties, _entity.isGroup);
            if (!carrier.value.empty()) _extras.push_back("+" + vcardFormatLine(carrier));
        }
    }

    // Lines whose values are written from a list.
    void finishListCarriers() {
        for (auto& [line, name, value] : _listCarriers) {
            VCardLine carrier;
            if (keptGroup(*line)) carrier.group = line->group;
            carrier.name = name;
            for (const auto& p : line->parameters)
                if (!isSpent(p)) carrier.parameters.push_back(p);
            if (carrier.group.empty() && carrier.parameters.empty()) continue;
            carrier.value = std::move(value);
            _extras.push_back("+" + vcardFormatLine(carrier));
        }
    }

    static bool addSurplus(const VCardLine& line, VCardLine& carrier) {
        std::string listed = vcardListedName(line);
        if (!listed.empty()) return carrier.add("X-ROLVANE-RAW", listed), true;
        std::string surplus = vcardSurplusParts(line);
        if (!surplus.empty()) carrier.add("X-ROLVANE-REST", surplus);
        return !surplus.empty();
    }

    // What a line says besides its value and label; nothing when that is all.
    std::optional<VCardLine> carrierOf(const MultiCarrier& from, bool withPreference) const {
        const VCardLine& line = *from.line;
        VCardLine carrier;
        carrier.name = from.field->lineName;
        auto types = line.types();
        bool needed = keptGroup(line) || vcardTypesAddToLabel(from.field->lineName, from.label, types);
        for (const auto& t : types)
            if (t != "pref" && !t.empty()) carrier.add("TYPE", t);
        for (const auto& p : line.parameters) {
            bool said = isSpent(p) || p.name == "TYPE" || p.name == "PREF" || p.name == "X-ROLVANE-LABEL" ||
                        (p.name == "CC" && from.field->property == std::string_view(kCXAddressProperty));
            if (said) continue;
            carrier.parameters.push_back(p);
            needed = true;
        }
        if (addSurplus(line, carrier)) needed = true;
        int preference = preferenceOf(line);
        if (withPreference && preference < kNoPreference)
            carrier.add("PREF", std::to_string(preference)), needed = true;
        if (!needed) return std::nullopt;
        if (keptGroup(line)) carrier.group = line.group;
        carrier.add("X-ROLVANE-LABEL", from.label);
        return carrier;
    }

    void finishMultiCarriers() {
        std::map<std::string_view, std::vector<const MultiCarrier*>> ofExact;
        for (const auto& from : _multiCarriers) {
            if (isExact(from.field->property))
                ofExact[from.field->property].push_back(&from);
            else
                carry(from, vcardEncodeMultiValue(from.field->property, from.value), true);
        }
        for (auto& [property, all] : ofExact) finishExactCarriers(property, all);
    }

    void carry(const MultiCarrier& from, std::optional<std::string> raw, bool withPreference) {
        auto carrier = raw ? carrierOf(from, withPreference) : std::nullopt;
        if (!carrier) return;
        carrier->value = std::move(*raw);
        _extras.push_back("+" + vcardFormatLine(*carrier));
    }

    // An exact value has the last word on what entries there are and on their order, which a preference must fit.
    void finishExactCarriers(std::string_view property, std::vector<const MultiCarrier*>& all) {
        auto multi = CXMultiValue::fromValue(_entity.properties[property]);
        if (!multi) return;
        std::stable_sort(all.begin(), all.end(), [](const MultiCarrier* a, const MultiCarrier* b) {
            return preferenceOf(*a->line) < preferenceOf(*b->line);
        });
        int last = 0;
        for (const auto& entry : multi->entries()) {
            auto raw = vcardEncodeMultiValue(property, entry.value);
            if (!raw || !vcardIsPlainText(entry.label)) continue;
            auto own = std::find_if(all.begin(), all.end(), [&](const MultiCarrier* c) {
                return c->label == entry.label && c->value == entry.value;
            });
            int preference = own == all.end() ? kNoPreference : preferenceOf(*(*own)->line);
            bool fits = preference >= last;
            last = fits ? preference : kNoPreference;
            if (own == all.end()) continue;
            carry(**own, std::move(raw), fits);
            all.erase(own);
        }
    }

    void storeExtras() {
        finishSingleCarriers();
        finishListCarriers();
        finishMultiCarriers();
        if (_extras.empty()) return;
        std::sort(_extras.begin(), _extras.end());
        Array all;
        all.reserve(_extras.size());
        for (auto& e : _extras) all.append(std::move(e));
        _entity.properties.set(kCXVCardExtraProperty, all);
    }

    void keep(const VCardLine& line) {
        const auto kept = vcardKeptForm(line);
        if (!kept) return keepUnread(line, "the base64 of " + line.name + " is damaged");
        use(line.group);
        _extras.push_back(vcardFormatLine(*kept));
    }

    const VCard& _card;
    VCardError& _error;
    VCardEntity _entity;
    std::map<std::string, std::string, std::less<>> _labels; // group name -> custom label
    std::set<std::string, std::less<>> _usedLabels;          // group names
    std::vector<const VCardLine*> _labelLines;
    std::map<std::string, int, std::less<>> _groupUse;
    std::map<std::string, std::vector<Entry>, std::less<>> _multi;
    std::set<std::string, std::less<>> _seen;
    std::set<std::string> _categories;
    std::vector<std::pair<std::string, const VCardLine*>> _exact;
    std::vector<std::pair<const VCardLine*, std::string>> _singleCarriers; // with the names that are written
    std::vector<ListCarrier> _listCarriers;
    std::vector<MultiCarrier> _multiCarriers;
    std::vector<std::string> _extras;
};

} // namespace

std::optional<VCardEntity> vcardEntityFromCard(const VCard& card, VCardError& error) {
    return Reader(card, error).read();
}

std::vector<VCardLine> vcardKeptLines(const Dictionary& properties, std::string_view name) {
    std::vector<VCardLine> lines;
    const Array* extras = properties[kCXVCardExtraProperty].arrayIf();
    for (size_t i = 0; extras && i < extras->count(); i++) {
        const std::string& text = (*extras)[i].string();
        if (!text.starts_with(name)) continue;
        auto line = vcardParseLine(text);
        if (line && line->name == name) lines.push_back(std::move(*line));
    }
    return lines;
}

void vcardReplaceKeptLines(Dictionary& properties, std::string_view name, const std::vector<VCardLine>& lines) {
    std::vector<std::string> texts;
    if (const Array* extras = properties[kCXVCardExtraProperty].arrayIf())
        for (const auto& extra : *extras) {
            const auto line = extra.string().starts_with(name) ? vcardParseLine(extra.string()) : std::nullopt;
            if (!line || line->name != name) texts.push_back(extra.string());
        }
    for (const auto& line : lines) texts.push_back(vcardFormatLine(line));
    std::sort(texts.begin(), texts.end());
    Array all;
    for (auto& text : texts) all.append(std::move(text));
    if (all.empty())
        properties.remove(kCXVCardExtraProperty);
    else
        properties.set(kCXVCardExtraProperty, all);
}

std::string vcardMemberKey(std::string_view uid) {
    return vcardLower(vcardUUIDForUID(uid));
}

std::string vcardUIDForUUID(std::string_view uuid) {
    return "urn:uuid:" + std::string(uuid);
}

} // namespace rolvane
