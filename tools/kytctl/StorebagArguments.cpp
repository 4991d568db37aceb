// The command lines of kytctl keys, storebag and ring.
#include "tools/kytctl/Arguments.h"

namespace kyt::tools {

namespace {

constexpr char kRing[] =
    R"(Each device is in one of 100 rings, 00 to 99, which its identifier decides for good. A server that has an address for
each ring can hand out a bag to some of them first:
  kytctl ring --set 'https://bags.example.org/{ring}/bags/tolvar'
stores the ring's address as the user default kytreporting_storebag_url.)";

constexpr char kSimulated[] =
    R"(Besides the steps of kytctl session there is one that says what devices there are, with weights:
  {"do":"devices","countries":{"DE":3,"unknown":1},"families":{"Phone":1},"models":{"P1":1},"consent":0.8}
and "perDay" of a step "open" is how many such sessions a device has each day. What is not said is what the bag
names, in equal shares, and one that it does not name; the consent is given then.)";

// What is signed, and what of it the command line decides.
void addSigning(const Command& command, SignOptions& options) {
  command.option("bag", options.bag, "FILE.json, FILE.toml or FILE.plist").required();
  command.option("--key", options.key, "The private key, PEM").required();
  command.option("--serial", options.serial, "The bag's serial, which grows from bag to bag");
  command.option("--expires-in-days", options.expiresInDays, "The bag's expiry, in days from now");
}

// On their way to devices.
void addRollOut(const Command& program, const Command& bag, Arguments& a) {
  const Command publish = bag.command("publish", "Sign a bag and put it where a server hands it out");
  addSigning(publish, a.publish.sign);
  publish.option("--to", a.publish.folder, "The folder that the server hands out").required();
  publish.option("--name", a.publish.name, "The storebag's name; without it the file's, without its ending");
  publish.runs([&a] { a.status = publishCommand(a.publish); });
  const Command diff = bag.command("diff", "Tell what changes when one bag takes the place of another");
  diff.option("old", a.oldBag, "A document, or a bag (.json, .toml or .plist)").required();
  diff.option("new", a.newBag, "A document, or a bag (.json, .toml or .plist)").required();
  diff.runs([&a] { a.status = diffCommand(a.oldBag, a.newBag); });
  const Command probe = bag.command("probe", "Ask a server as the daemon does, and tell what it gets wrong");
  probe.option("url", a.probe.url, "The storebag's address, as https://bags.example.org/bags/tolvar/dulvek")
      .required();
  probe.option("--public-key", a.probe.publicKey, "The public key, instead of the device's");
  probe.option("--ca-file", a.probe.caFile, "Trusted authorities, PEM, instead of the device's");
  probe.runs([&a] { a.status = probeCommand(a.connection.root, a.probe); });

  const Command ring =
      program.command("ring", "Print in which of 100 rings this device is, or set its address");
  ring.option("--identifier", a.ring.identifier, "Of another device, as it reports it").notEmpty();
  ring.option("--set", a.ring.address, "Take storebags from this address from now on; {ring} is the ring")
      .notEmpty();
  ring.ends(kRing);
  ring.runs([&a] { a.status = ringCommand(a.connection.root, a.ring); });
}

}  // namespace

void addStorebag(const Command& program, Arguments& a) {
  const Command keys = program.command("keys", "Keys for signing storebags");
  keys.needsCommand();
  const Command make = keys.command("make", "Write private.pem and publicKey.der into a folder");
  make.option("folder", a.folder, "The folder; made when missing, its parent must exist").required();
  make.option("--bits", a.bits, "Length of the key, 2048 to 16384").showsDefault();
  make.runs([&a] { a.status = makeKeysCommand(a.folder, a.bits); });

  const Command bag = program.command("storebag", "Signed configurations");
  bag.needsCommand();
  const Command sign = bag.command("sign", "Sign a bag into the document that servers hand out");
  addSigning(sign, a.sign);
  sign.option("-o,--output", a.sign.output, "The document; - for standard output").required();
  sign.runs([&a] { a.status = signCommand(a.sign); });
  const Command verify = bag.command("verify", "Check a document's signature");
  verify.option("document", a.document, "The document; - for standard input").required();
  verify.option("--public-key", a.publicKey, "The public key, publicKey.der").required();
  verify.runs([&a] { a.status = verifyCommand(a.document, a.publicKey); });
  const Command show =
      bag.command("show", "Print the bag of a document as JSON, and what in it may surprise");
  show.option("document", a.document, "The document; - for standard input").required();
  show.option("--public-key", a.publicKey, "Check the signature with this public key first");
  show.runs([&a] { a.status = showCommand(a.document, a.publicKey); });
  const Command simulate =
      bag.command("simulate", "Tell how many sessions and events of many devices would leave");
  simulate.option("bag", a.simulate.bag, "A document, or a bag (.json, .toml or .plist)").required();
  simulate.option("--events", a.simulate.events, "Sessions and events: steps as kytctl session takes them")
      .required();
  simulate.option("--devices", a.simulate.devices, "How many devices").between(1, 1000000).showsDefault();
  simulate.option("--seed", a.simulate.seed, "The same seed gives the same figures").showsDefault();
  simulate.flag("--json", a.simulate.json, "Print one JSON object");
  simulate.ends(kSimulated);
  simulate.runs([&a] { a.status = simulateCommand(a.connection.root, a.simulate); });
  addRollOut(program, bag, a);
}

}  // namespace kyt::tools
