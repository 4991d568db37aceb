// Reporting from Node.js without the library: one event, by busctl, since Debian has no client for D-Bus in JavaScript. A
// call is a connection, and so a session, of its own; the daemon says "finished" when it has taken the event. For more than
// an event now and then see kytreporting.c beside this file.
const { execFile } = require("node:child_process");
const { promisify } = require("node:util");

const SOCKET = process.env.KYTREPORTING_SOCKET || "/run/kytreportingd/com.vantu.kytreportingd";

// A JavaScript value as busctl's words for a variant. Texts, numbers and booleans.
function variant(value) {
  switch (typeof value) {
    case "string":
      return ["s", value];
    case "boolean":
      return ["b", String(value)];
    case "number":
      return Number.isSafeInteger(value) ? ["x", String(value)] : ["d", String(value)];
    default:
      throw new TypeError(`a value of the type ${typeof value} cannot be sent`);
  }
}

function dictionary(entries) {
  const names = Object.keys(entries);
  return [String(names.length), ...names.flatMap((name) => [name, ...variant(entries[name])])];
}

// What the daemon says of one event: "finished", or "storebag not available".
async function report(information, user, category, type, payload) {
  const { stdout } = await promisify(execFile)("busctl", [
    `--address=unix:path=${SOCKET}`,
    "--json=short",
    "call",
    "com.vantu.kytreportingd",
    "/com/vantu/kytreportingd",
    "com.vantu.kytreportingd.ClientSessionInterface",
    "SendMessageWithSessionInfo",
    "a{sv}aa{sv}qqaa{sv}",
    "--",
    ...dictionary(information),
    "1",
    ...dictionary(user),
    String(category),
    String(type),
    "1",
    ...dictionary(payload),
  ]);
  return JSON.parse(stdout).data[0];
}

async function main() {
  const information = { SessionID: 46, ClientType: 20, RequireUserInfo: true };
  const said = await report(information, { ClientName: "hello", ServiceName: "demo" }, 10, 1, { step: 1 });
  console.log(said);
  if (said !== "finished") process.exitCode = 1;
}

main().catch((error) => {
  console.error(`report: ${error.message}`);
  process.exitCode = 1;
});
