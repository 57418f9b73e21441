// Validate FILE...: each finding of ez-vcard about each card, one a line; the number of cards. Exit code 1 with findings.
import ezvcard.VCard;
import ezvcard.io.text.VCardReader;
import java.io.File;

class Validate {
    public static void main(String[] files) throws Exception {
        int cards = 0, findings = 0;
        for (String file : files)
            try (VCardReader reader = new VCardReader(new File(file))) {
                for (VCard card; (card = reader.readNext()) != null; cards++) {
                    for (var warning : reader.getWarnings()) {
                        findings++;
                        System.out.println("reading: " + warning);
                    }
                    for (var problems : card.validate(card.getVersion()))
                        for (var problem : problems.getValue()) {
                            findings++;
                            System.out.println(name(card) + ": " + problems.getKey() + ": " + problem);
                        }
                }
            }
        System.out.println(cards + " cards, " + findings + " findings");
        System.exit(findings > 0 || cards == 0 ? 1 : 0);
    }

    private static String name(VCard card) {
        return card.getFormattedName() == null ? "(no name)" : card.getFormattedName().getValue();
    }
}
