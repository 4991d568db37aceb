cc -shared -fPIC "$EXAMPLES/node/kytreporting.c" -I"$(dirname "$(command -v node)")/../include/node" \
  $(pkg-config --cflags --libs kytreporting) -o kytreporting.node
cat > hello.js <<'END'
const kyt = require("./kytreporting.node");

const session = kyt.open(20, "hello", "demo");
kyt.send(session, 10, 1, { step: 1 });
process.exitCode = kyt.finish(session, 5000) ? 0 : 1;
END
kytdemo --stage -- node hello.js
