<?php
// validate.php FILE: each card of the file that is not valid, one a line. Exit code 1 when there is any.
require '/usr/share/php/Sabre/VObject/autoload.php';
use Sabre\VObject\Node;
use Sabre\VObject\Splitter\VCard;
$cards = 0;
$bad = 0;
$splitter = new VCard(fopen($argv[1], 'r'));
while ($card = $splitter->getNext()) {
    $cards++;
    foreach ($card->validate() as $finding) {
        if ($finding['level'] < 3) continue;
        $bad++;
        echo $card->FN, ': ', $finding['message'], "\n";
    }
}
echo "$cards cards\n";
exit($bad > 0 || $cards == 0 ? 1 : 0);
