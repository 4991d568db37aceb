// Reporting from Go without the library, over D-Bus (Debian's golang-dbus-dev). The connection is the session; it goes to
// the daemon itself and not to a bus, so there is no Hello. Reconnecting, queueing and counting are the program's own
// business here: the library does them for report.go.
package main

import (
	"fmt"
	"os"

	"github.com/godbus/dbus" // with modules: github.com/godbus/dbus/v5
)

const session = "com.vantu.kytreportingd.ClientSessionInterface."

type entries = map[string]dbus.Variant

func report() error {
	socket := os.Getenv("KYTREPORTING_SOCKET")
	if socket == "" {
		socket = "/run/kytreportingd/com.vantu.kytreportingd"
	}
	daemon, err := dbus.Dial("unix:path=" + dbus.EscapeBusAddressValue(socket))
	if err != nil {
		return err
	}
	defer daemon.Close()
	if err := daemon.Auth(nil); err != nil {
		return err
	}
	object := daemon.Object("com.vantu.kytreportingd", "/com/vantu/kytreportingd") // any name: nobody else is there

	information := entries{
		"SessionID":       dbus.MakeVariant(uint32(44)),
		"ClientType":      dbus.MakeVariant(int32(20)),
		"RequireUserInfo": dbus.MakeVariant(true),
	}
	user := entries{"ClientName": dbus.MakeVariant("hello"), "ServiceName": dbus.MakeVariant("demo")}
	// What may be none is an array of nothing or one: the user's information, and no frameworks to check.
	call := object.Call(session+"SetSessionInfo", 0, information, []entries{user}, []dbus.Variant{}, false)
	if call.Err != nil {
		return call.Err
	}
	var live [][]string
	if err := object.Call(session+"StartConfigWithCompletionHandler", 0).Store(&live); err != nil {
		return err
	}
	fmt.Println("live back ends:", live)
	message := entries{
		"Category": dbus.MakeVariant(int32(10)),
		"Type":     dbus.MakeVariant(int32(1)),
		"Payload":  dbus.MakeVariant(entries{"step": dbus.MakeVariant(int32(1))}),
	}
	if call := object.Call(session+"SendMessageWithDictionary", 0, message); call.Err != nil {
		return call.Err
	}
	return object.Call(session+"FinishSessionGracefully", 0).Err
}

func main() {
	if err := report(); err != nil {
		fmt.Fprintln(os.Stderr, "report:", err)
		os.Exit(1)
	}
}
