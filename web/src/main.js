console.log("hi")
